// Draws one depth of one channel by rays: at once and coarsely while things move, then finer and finer.

import marchSource from './march.glsl';
import showSource from './show.glsl';
import { Target, program, table, texture } from './gl.js';
import { Lattice } from './light.js';
import { Transfer } from './transfer.js';
import { add, edge, inverse, mul, normalized, sub, vector, length } from './vec.js';

export const MODES = ['fog', 'surface', 'mip', 'mean'];
// Of each pixel, at rest; and the longest time that one step of work takes.
const SAMPLES = { fog: 8, surface: 24, mip: 4, mean: 4 };
const PIECE_MS = 40, MOVING_MS = 33;
// Points of the lattice of light along its longest axis.
const LATTICE_MOVING = 40, LATTICE_REST = 128;

export class Renderer {
  constructor(canvas, tables) {
    const gl = canvas.getContext('webgl2', { antialias: false, alpha: false, depth: false });
    if (!gl) throw new Error('This browser or graphics card has no WebGL 2.');
    this.gl = gl, this.canvas = canvas, this.tables = tables;
    gl.pixelStorei(gl.UNPACK_ALIGNMENT, 1);
    this.march = program(gl, marchSource);
    this.show = program(gl, showSource);
    this.moving = new Target(gl), this.rest = new Target(gl);
    this.light = texture(gl, gl.TEXTURE_3D, gl.LINEAR);
    this.transferTexture = texture(gl, gl.TEXTURE_2D, gl.NEAREST);
    this.seen = texture(gl, gl.TEXTURE_2D, gl.NEAREST);
    this.scale = 0.5;
    this.most = Infinity; // samples, for scripts that are in a hurry
    this.samples = 0, this.row = 0, this.rows = 16;
    this.sizeLimit = gl.getParameter(gl.MAX_3D_TEXTURE_SIZE);
  }

  /** Puts the bricks of a tree where shaders find them. */
  load(tree) {
    const gl = this.gl, count = tree.slots + 1, most = Math.floor(this.sizeLimit / 9);
    const across = Math.min(most, Math.ceil(Math.cbrt(count)));
    const slots = [across, across, Math.ceil(count / across / across)];
    if (slots[2] > most) throw new Error('The volume is too large for this graphics card.');
    const made = { tree, slots, atlas: texture(gl, gl.TEXTURE_3D, gl.LINEAR),
      entries: texture(gl, gl.TEXTURE_2D, gl.NEAREST), bricks: texture(gl, gl.TEXTURE_2D, gl.NEAREST), lattices: new Map() };
    gl.bindTexture(gl.TEXTURE_3D, made.atlas);
    gl.texStorage3D(gl.TEXTURE_3D, 1, gl.R8, 9 * slots[0], 9 * slots[1], 9 * slots[2]);
    const width = 9 * slots[0], height = 9 * slots[1], slab = new Uint8Array(width * height * 9);
    for (let z = 0, slot = 0; z < slots[2]; ++z) {
      slab.fill(0);
      for (let y = 0; y < slots[1]; ++y)
        for (let x = 0; x < slots[0] && slot < tree.slots; ++x, ++slot)
          for (let row = 0; row < 81; ++row) {
            const from = 729 * slot + 9 * row, to = (Math.floor(row / 9) * height + 9 * y + row % 9) * width + 9 * x;
            slab.set(tree.bricks.codes.subarray(from, from + 9), to);
          }
      gl.texSubImage3D(gl.TEXTURE_3D, 0, 0, 0, 9 * z, width, height, 9, gl.RED, gl.UNSIGNED_BYTE, slab);
    }
    table(gl, made.entries, gl.R32UI, gl.RED_INTEGER, gl.UNSIGNED_INT, tree.entries, 1);
    const bricks = new Float32Array(4 * tree.bricks.count);
    for (let n = 0; n < tree.bricks.count; ++n) {
      bricks[4 * n] = tree.bricks.low[n];
      bricks[4 * n + 1] = tree.bricks.high[n] - tree.bricks.low[n];
      bricks[4 * n + 2] = tree.slot[n];
    }
    table(gl, made.bricks, gl.RGBA32F, gl.RGBA, gl.FLOAT, bricks, 4);
    return made;
  }

  /** @param loaded By load(). @param channel Its description. @param look What the controls say. */
  use(loaded, channel, look) {
    const gl = this.gl, tree = loaded.tree;
    this.loaded = loaded, this.channel = channel, this.look = look;
    this.transfer = new Transfer(this.tables, look);
    gl.bindTexture(gl.TEXTURE_2D, this.transferTexture);
    gl.texImage2D(gl.TEXTURE_2D, 0, gl.RGBA32F, 256, 1, 0, gl.RGBA, gl.FLOAT, this.transfer.texels);
    const { background } = channel;
    const matters = look.mode === 'fog' ? (low, high) => this.transfer.shows(low, high)
      : look.mode === 'surface' ? (low, high) => low < look.iso && high >= look.iso
      : (low, high) => !(low === high && low === background);
    table(gl, this.seen, gl.R32UI, gl.RED_INTEGER, gl.UNSIGNED_INT, tree.visible(matters), 1);
    this.lit = null;
    // Lengths of src/Render/Renderer.cpp, of voxels as wide as the samples of this depth.
    const spacing = tree.spacing, box = sub(channel.boxHigh, channel.boxLow);
    this.voxel = Math.min(edge(channel.rows, 0), edge(channel.rows, 1), edge(channel.rows, 2)) * spacing;
    this.diagonal = length(vector(channel.rows, box));
    this.step = Math.min(Math.max(0.8 * this.voxel, this.diagonal / 65536), this.diagonal / 320 * spacing);
    this.toLocal = inverse(channel.rows);
    this.unit = channel.unit / look.density;
    this.restart();
  }

  restart() {
    this.samples = 0, this.row = 0;
  }
  get done() {
    return this.samples >= Math.min(this.most, SAMPLES[this.look.mode]);
  }

  // Light through the fog from the lamp and from above; what does not change with the camera is kept.
  illuminate(lamp, viewUp, most) {
    const { loaded, channel } = this, key = String([most, lamp, viewUp]);
    if (this.look.mode !== 'fog' || this.lit === key) return;
    let lattice = loaded.lattices.get(most);
    if (!lattice) {
      lattice = new Lattice(loaded.tree, { low: channel.boxLow, high: channel.boxHigh }, channel.rows, most);
      loaded.lattices.set(most, lattice);
    }
    if (lattice.transfer !== this.transfer || lattice.unit !== this.unit || lattice.viewUp !== String(viewUp)) {
      lattice.weigh(this.transfer, 1 / this.unit);
      lattice.above = lattice.sweep(vector(this.toLocal, viewUp));
      lattice.transfer = this.transfer, lattice.unit = this.unit, lattice.viewUp = String(viewUp);
    }
    const direct = lattice.sweep(vector(this.toLocal, lamp)), both = new Float32Array(2 * direct.length);
    for (let n = 0; n < direct.length; ++n) both[2 * n] = direct[n], both[2 * n + 1] = lattice.above[n];
    const gl = this.gl;
    gl.bindTexture(gl.TEXTURE_3D, this.light);
    gl.texImage3D(gl.TEXTURE_3D, 0, gl.RG16F, ...lattice.size, 0, gl.RG, gl.FLOAT, both);
    this.lit = key, this.lattice = lattice;
  }

  bind(target, camera, isMoving) {
    const gl = this.gl, { at } = this.march, { loaded, channel, look } = this, tree = loaded.tree;
    const aspect = this.canvas.width / this.canvas.height, [half, halfWidth] = camera.halves(aspect);
    const up = camera.up, right = camera.right;
    const lamp = this.lamp ?? normalized(add(add(mul(up, 0.9), mul(right, -0.75)), mul(camera.forward, -0.8)));
    this.illuminate(lamp, camera.viewUp, isMoving ? LATTICE_MOVING : LATTICE_REST);

    gl.useProgram(this.march.program);
    const bound = { uTree: [gl.TEXTURE_2D, loaded.entries], uSeen: [gl.TEXTURE_2D, this.seen],
      uBricks: [gl.TEXTURE_2D, loaded.bricks], uAtlas: [gl.TEXTURE_3D, loaded.atlas],
      uTransfer: [gl.TEXTURE_2D, this.transferTexture], uLight: [gl.TEXTURE_3D, this.light] };
    Object.entries(bound).forEach(([name, [kind, made]], n) => {
      gl.activeTexture(gl.TEXTURE0 + n);
      gl.bindTexture(kind, made);
      gl.uniform1i(at[name], n);
    });
    gl.activeTexture(gl.TEXTURE0 + 8); // what is made from here on disturbs none of them

    const samples = (local) => local.map((v, a) => (v - tree.origin[a]) / tree.spacing);
    const toSamples = this.toLocal.map((row) => mul(row, 1 / tree.spacing));
    gl.uniform1i(at.uLevels, tree.levels);
    gl.uniform3iv(at.uSlots, loaded.slots);
    gl.uniform3fv(at.uAtlasScale, loaded.slots.map((n) => 1 / (9 * n)));
    gl.uniform3fv(at.uBoxLow, samples(channel.boxLow));
    gl.uniform3fv(at.uBoxHigh, samples(channel.boxHigh));
    gl.uniform1f(at.uBackground, channel.background);
    gl.uniform2f(at.uSize, target.width, target.height);
    gl.uniform3fv(at.uEye, samples(vector(this.toLocal, sub(camera.position, channel.shift))));
    gl.uniform3fv(at.uForward, camera.forward);
    gl.uniform3fv(at.uRight, right);
    gl.uniform3fv(at.uUp, up);
    gl.uniform2f(at.uHalves, halfWidth, half);
    // Columns of the matrix, of which the rows are known.
    gl.uniformMatrix3fv(at.uToSamples, true, toSamples.flat());
    gl.uniform3fv(at.uLamp, lamp);
    if (look.mode === 'fog') {
      // lattice = (local - low) * scale, a texel's middle at a half
      const { low, scale, size } = this.lattice;
      gl.uniform3fv(at.uLightScale, scale.map((s, a) => s * tree.spacing / size[a]));
      gl.uniform3fv(at.uLightLow, scale.map((s, a) => ((tree.origin[a] - low[a]) * s + 0.5) / size[a]));
    }
    gl.uniform1i(at.uMode, MODES.indexOf(look.mode));
    gl.uniform1f(at.uStep, (look.mode === 'fog' ? this.step : 0.5 * this.voxel) * (isMoving ? 2 : 1));
    gl.uniform1f(at.uPerUnit, 1 / this.unit);
    gl.uniform1f(at.uIso, look.iso);
    gl.uniform1f(at.uLow, this.transfer.low);
    gl.uniform1f(at.uScale, this.transfer.scale);
    gl.uniform1i(at.uLog, this.transfer.log);
    gl.uniform1i(at.uColored, look.colored);
    gl.uniform1f(at.uDiagonal, this.diagonal);
    gl.uniform1f(at.uVoxel, this.voxel);
    const axis = 'xyz'.indexOf(look.slice);
    gl.uniform1i(at.uSlice, axis);
    gl.uniform1i(at.uCut, look.cut);
    if (axis >= 0) {
      const low = channel.boxLow[axis], high = channel.boxHigh[axis];
      gl.uniform1f(at.uSlicePlace, (low + (high - low) * look.slicePlace - tree.origin[axis]) / tree.spacing);
    }
  }

  draw(target, sample, rays, from, rows) {
    const gl = this.gl, { at } = this.march;
    // The first sample through the middle of the pixel, as a picture of one sample has it.
    const jitter = (by) => sample === 0 ? 0 : (0.5 + by * sample) % 1 - 0.5;
    gl.uniform2f(at.uJitter, jitter(0.7548776662), jitter(0.5698402910));
    gl.uniform1f(at.uShift, sample === 0 ? 0 : (0.6180339887 * sample) % 1);
    gl.uniform1i(at.uRays, rays);
    gl.uniform1i(at.uSample, sample);
    gl.bindFramebuffer(gl.FRAMEBUFFER, target.frame);
    gl.viewport(0, 0, target.width, target.height);
    gl.enable(gl.SCISSOR_TEST);
    gl.scissor(0, from, target.width, rows);
    // The mean of all samples so far.
    gl.enable(gl.BLEND);
    gl.blendFunc(gl.CONSTANT_ALPHA, gl.ONE_MINUS_CONSTANT_ALPHA);
    gl.blendColor(0, 0, 0, 1 / (sample + 1));
    gl.drawArrays(gl.TRIANGLES, 0, 3);
    gl.disable(gl.BLEND);
    gl.disable(gl.SCISSOR_TEST);
  }

  /** A picture now, as fine as lets the next one come soon. */
  drawMoving(camera) {
    const began = performance.now(), { width, height } = this.canvas;
    this.moving.resize(Math.max(1, Math.round(width * this.scale)), Math.max(1, Math.round(height * this.scale)));
    this.bind(this.moving, camera, true);
    this.draw(this.moving, 0, 0, 0, this.moving.height);
    this.moving.wait();
    const took = performance.now() - began;
    this.scale = Math.min(1, Math.max(0.08, this.scale * Math.min(1.25, Math.max(0.5, Math.sqrt(MOVING_MS / took)))));
    this.present(this.moving);
    this.restart();
  }

  /** Some more of the picture at rest. */
  refine(camera) {
    const { width, height } = this.canvas;
    if (this.rest.resize(width, height)) this.restart();
    this.bind(this.rest, camera, false);
    const began = performance.now(), rows = Math.min(this.rows, height - this.row);
    this.draw(this.rest, this.samples, 2, this.row, rows);
    this.rest.wait();
    const took = performance.now() - began;
    this.rows = Math.min(height, Math.max(1, Math.round(this.rows * Math.min(2, Math.max(0.25, PIECE_MS / took)))));
    this.row += rows;
    if (this.row < height) return;
    this.row = 0, ++this.samples;
    this.present(this.rest);
  }

  present(target) {
    const gl = this.gl;
    gl.useProgram(this.show.program);
    gl.activeTexture(gl.TEXTURE0);
    gl.bindTexture(gl.TEXTURE_2D, target.texture);
    gl.uniform1i(this.show.at.uPicture, 0);
    gl.uniform2f(this.show.at.uSize, this.canvas.width, this.canvas.height);
    gl.uniform3fv(this.show.at.uBackground, this.look.background);
    gl.bindFramebuffer(gl.FRAMEBUFFER, null);
    gl.viewport(0, 0, this.canvas.width, this.canvas.height);
    gl.drawArrays(gl.TRIANGLES, 0, 3);
    this.presented = target;
  }
}
