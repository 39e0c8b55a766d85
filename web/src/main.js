// The page of `vln view`: reads what it holds, then draws whatever the controls ask for.

import { about, bricksOf, tablesOf, unpack } from './data.js';
import { Camera } from './camera.js';
import { panel, pointPanel, pointers } from './controls.js';
import { PointRenderer } from './points.js';
import { Renderer } from './renderer.js';
import style from './style.css';
import { Tree } from './tree.js';

const REST_MS = 150; // without a movement, after which the picture is refined

function element(name, id) {
  const made = document.body.appendChild(document.createElement(name));
  if (id) made.id = id;
  return made;
}

const linear = (hex) => [1, 3, 5].map((at) => {
  const s = parseInt(hex.slice(at, at + 2), 16) / 255;
  return s <= 0.04045 ? s / 12.92 : ((s + 0.055) / 1.055) ** 2.4;
});

class Page {
  constructor() {
    document.head.appendChild(document.createElement('style')).textContent = style;
    this.canvas = element('canvas');
    this.message = element('div', 'message');
    this.about = about();
    this.look = { backgroundColor: '#6b727a', background: linear('#6b727a') };
    this.movedAt = -Infinity;
  }

  async start() {
    this.camera = new Camera(this.about.camera);
    const actions = { screenshot: () => this.screenshot(), reset: () => (this.camera.reset(), this.moved()) };
    if (this.about.points) await this.startPoints(actions);
    else await this.startVolume(actions);
    if (innerWidth < 500) this.panel.gui.close();
    pointers(this.canvas, this.camera, () => this.moved());
    new ResizeObserver(() => this.resize()).observe(this.canvas);
    this.resize();
    this.canvas.addEventListener('webglcontextlost', () => this.tell('The graphics card gave up; loading the page again may help.'));
    if (this.about.channels) await this.showDepths();
    const loop = () => {
      this.frame();
      requestAnimationFrame(loop);
    };
    requestAnimationFrame(loop);
  }

  async startVolume(actions) {
    Object.assign(this.look, { channel: this.about.channels[0].name, slice: 'off', slicePlace: 0.5, cut: false });
    this.renderer = new Renderer(this.canvas, tablesOf(this.about, await unpack(0)));
    this.renderer.lamp = this.about.light;
    this.loaded = new Map();
    this.takeChannel();
    this.panel = panel(this.about, this.look, this.range, actions, (what) => this.changed(what));
    this.panel.update(this.range);
  }

  async startPoints(actions) {
    const renderer = this.renderer = new PointRenderer(this.canvas, this.about.points, await unpack(0));
    const changed = () => {
      renderer.look.background = [1, 3, 5].map((at) => parseInt(this.look.backgroundColor.slice(at, at + 2), 16) / 255);
      this.moved();
    };
    this.panel = pointPanel(this.about, this.look, renderer.look, actions, changed);
    this.inUse = true;
    changed();
  }

  // The coarsest depth first: something is seen while the rest is unpacked.
  async showDepths() {
    const wanted = this.look.depth;
    for (const depth of new Set([this.range.depths[0], wanted])) {
      this.look.depth = depth;
      await this.useDepth();
      this.frame();
    }
    this.panel.show();
  }

  tell(text) {
    this.message.textContent = text;
  }

  // What a channel comes with becomes the look.
  takeChannel() {
    const c = this.channel = this.about.channels.find((c) => c.name === this.look.channel);
    const own = c.ownOpacity && { table: c.ownOpacity, range: c.range, log: c.log };
    Object.assign(this.look, { mode: c.mode,
      iso: c.mode === 'surface' ? c.iso : (c.range[0] + c.range[1]) / 2, colors: c.colors, colored: c.colored, log: c.log, opacity: c.opacity,
      own, awayFrom: c.awayFrom, low: c.range[0], high: c.range[1], logDensity: 0, density: 1, depth: c.levels.at(-1).depth });
    this.range = { low: Math.min(c.low, c.range[0]), high: Math.max(c.high, c.range[1]),
      depths: c.levels.map((l) => l.depth), ownOpacity: own && c.opacity };
  }

  async useDepth() {
    const level = this.channel.levels.find((l) => l.depth === this.look.depth);
    let loading = this.loaded.get(level.block);
    if (!loading) {
      const { channel } = this;
      loading = unpack(level.block).then((buffer) =>
        this.renderer.load(new Tree(level, bricksOf(level, buffer), channel.background)));
      this.loaded.set(level.block, loading);
    }
    const loaded = await loading;
    if (this.channel.levels.includes(level)) this.inUse = loaded, this.useLook();
  }

  useLook() {
    this.look.range = [this.look.low, this.look.high];
    this.renderer.use(this.inUse, this.channel, this.look);
    this.moved();
  }

  async changed(what) {
    this.look.background = linear(this.look.backgroundColor);
    if (what === 'channel') {
      this.takeChannel();
      this.panel.update(this.range);
    }
    if (what === 'look') this.panel.show(), this.useLook();
    else if (what === 'picture') this.moved();
    else await this.useDepth();
  }

  moved() {
    this.movedAt = performance.now();
    this.isDirty = true;
    this.canvas.dataset.samples = 0;
  }

  resize() {
    const scale = window.devicePixelRatio || 1;
    const width = Math.max(1, Math.round(this.canvas.clientWidth * scale));
    const height = Math.max(1, Math.round(this.canvas.clientHeight * scale));
    if (width === this.canvas.width && height === this.canvas.height) return;
    this.canvas.width = width, this.canvas.height = height;
    this.moved();
  }

  frame() {
    if (!this.inUse) return;
    const { renderer } = this;
    if (this.isDirty) {
      this.isDirty = false;
      renderer.drawMoving(this.camera);
    } else if (performance.now() - this.movedAt > REST_MS && !renderer.done) {
      renderer.refine(this.camera);
      this.canvas.dataset.samples = renderer.samples;
      if (renderer.done) this.canvas.dataset.done = renderer.samples;
    }
    if (!renderer.done) delete this.canvas.dataset.done;
  }

  /** The picture as it is, without the panel, as a file. */
  screenshot() {
    this.renderer.present(this.renderer.presented);
    this.canvas.toBlob((blob) => {
      const link = document.createElement('a');
      link.href = URL.createObjectURL(blob);
      link.download = this.about.title.replace(/\.[^.]*$/, '') + '.png';
      link.click();
      setTimeout(() => URL.revokeObjectURL(link.href), 1000);
    });
  }
}

const page = new Page();
page.start().catch((error) => {
  page.tell(error.message);
  throw error;
});
// For scripts that drive the page.
globalThis.vlnView = page;
