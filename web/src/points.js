// Draws points as discs that face the camera.

import { link } from './gl.js';
import { dot, length, sub } from './vec.js';

const VERTEX = `#version 300 es
precision highp float;
in vec3 place;  // between the ends of the box
in vec3 color;
uniform vec3 uSize, uEye; // of the box; the eye from its lowest corner
uniform vec3 uRight, uUp, uForward;
uniform vec2 uHalves, uEnds;
uniform float uDiameter;  // in pixels, at distance 1
out vec3 shade;
void main() {
  vec3 p = place * uSize - uEye;
  float d = dot(p, uForward);
  gl_Position = vec4(dot(p, uRight) / uHalves.x, dot(p, uUp) / uHalves.y,
    ((uEnds.x + uEnds.y) * d - 2.0 * uEnds.x * uEnds.y) / (uEnds.y - uEnds.x), d);
  gl_PointSize = max(1.0, uDiameter / max(d, 1e-30));
  shade = color;
}`;
const FRAGMENT = `#version 300 es
precision highp float;
in vec3 shade;
out vec4 result;
void main() {
  vec2 c = gl_PointCoord * 2.0 - 1.0;
  float r = dot(c, c);
  if (r > 1.0) discard;
  result = vec4(shade * (1.0 - 0.3 * r * r), 1.0); // a darker rim tells discs apart
}`;

export class PointRenderer {
  /** @param points What the page tells of them. @param buffer Places as codes of 16 bits, colours as bytes of sRGB. */
  constructor(canvas, points, buffer) {
    const gl = canvas.getContext('webgl2', { antialias: true, alpha: false, depth: true });
    if (!gl) throw new Error('This browser or graphics card has no WebGL 2.');
    this.gl = gl, this.canvas = canvas, this.points = points;
    this.look = { size: 1, background: [0, 0, 0] };
    this.made = link(gl, VERTEX, FRAGMENT);
    const n = points.count;
    this.attribute('place', new Uint16Array(buffer, 0, 3 * n), gl.UNSIGNED_SHORT);
    this.attribute('color', new Uint8Array(buffer, 6 * n, 3 * n), gl.UNSIGNED_BYTE);
    this.done = false, this.samples = 0;
  }
  attribute(name, values, type) {
    const gl = this.gl, at = gl.getAttribLocation(this.made.program, name);
    gl.bindBuffer(gl.ARRAY_BUFFER, gl.createBuffer());
    gl.bufferData(gl.ARRAY_BUFFER, values, gl.STATIC_DRAW);
    gl.enableVertexAttribArray(at);
    gl.vertexAttribPointer(at, 3, type, true, 0, 0);
  }

  drawMoving(camera) {
    this.camera = camera;
    this.present();
    this.done = false, this.samples = 0;
  }
  /** Points are as fine as they get. */
  refine(camera) {
    this.drawMoving(camera);
    this.done = true, this.samples = 1;
  }
  present() {
    const { gl, points, camera } = this, { at, program } = this.made, { width, height } = this.canvas;
    const [half, halfWidth] = camera.halves(width / height), eye = sub(camera.position, points.origin);
    // What lies before the eye, between the ends of the box.
    const size = length(points.size), middle = points.size.map((s) => s / 2);
    const away = dot(sub(middle, eye), camera.forward);
    const far = Math.max(away + size, 1e-3 * size), near = Math.max(away - size, 1e-4 * far);
    gl.useProgram(program);
    gl.bindFramebuffer(gl.FRAMEBUFFER, null);
    gl.viewport(0, 0, width, height);
    gl.clearColor(...this.look.background, 1);
    gl.clear(gl.COLOR_BUFFER_BIT | gl.DEPTH_BUFFER_BIT);
    gl.enable(gl.DEPTH_TEST);
    gl.uniform3fv(at.uSize, points.size);
    gl.uniform3fv(at.uEye, eye);
    gl.uniform3fv(at.uRight, camera.right);
    gl.uniform3fv(at.uUp, camera.up);
    gl.uniform3fv(at.uForward, camera.forward);
    gl.uniform2f(at.uHalves, halfWidth, half);
    gl.uniform2f(at.uEnds, near, far);
    gl.uniform1f(at.uDiameter, this.look.size * points.radius / half * height);
    gl.drawArrays(gl.POINTS, 0, points.count);
  }
}
