// What the user can turn: the panel, pointers on the picture, the wheel.

import GUI from 'lil-gui';
import { MODES } from './renderer.js';

/** @param changed Called with what must be made anew: 'channel', 'depth', 'look' or 'picture'. */
export function panel(page, look, range, actions, changed) {
  const gui = new GUI({ title: page.title });
  const names = page.channels.map((c) => c.name);
  const looks = () => changed('look');
  if (names.length > 1) gui.add(look, 'channel', names).name('channel').onChange(() => changed('channel'));
  gui.add(look, 'mode', MODES).onChange(looks);
  const density = gui.add(look, 'logDensity', -2, 2, 0.01).name('density, 10^').onChange(() => {
    look.density = 10 ** look.logDensity;
    looks();
  });
  const iso = gui.add(look, 'iso', range.low, range.high).onChange(looks);
  const depth = gui.add(look, 'depth', range.depths[0], range.depths.at(-1), 1).onChange(() => changed('depth'));

  const colors = gui.addFolder('Colours and opacity');
  const colored = colors.add(look, 'colored').name('colours').onChange(looks);
  colors.add(look, 'colors', page.colorMaps).name('map').onChange(looks);
  const opacity = colors.add(look, 'opacity', page.opacities).onChange(looks);
  const low = colors.add(look, 'low', range.low, range.high).onChange(looks);
  const high = colors.add(look, 'high', range.low, range.high).onChange(looks);
  colors.add(look, 'log').name('logarithm').onChange(looks);
  colors.addColor(look, 'backgroundColor').name('background').onChange(() => changed('picture'));

  const slice = gui.addFolder('Slice');
  slice.add(look, 'slice', ['off', 'x', 'y', 'z']).name('plane').onChange(() => changed('picture'));
  slice.add(look, 'slicePlace', 0, 1, 0.002).name('place').onChange(() => changed('picture'));
  slice.add(look, 'cut').name('cut away').onChange(() => changed('picture'));

  gui.add(actions, 'screenshot');
  gui.add(actions, 'reset').name('reset camera');

  for (const folder of [colors, slice]) folder.close();

  const update = (range) => {
    const step = (range.high - range.low) / 500;
    for (const c of [iso, low, high]) c.min(range.low).max(range.high).step(step || 1e-6);
    depth.min(range.depths[0]).max(range.depths.at(-1)).enable(range.depths.length > 1);
    opacity.options(range.ownOpacity ? [range.ownOpacity, ...page.opacities] : page.opacities).onChange(looks);
    show();
  };
  const show = () => {
    iso.show(look.mode === 'surface');
    density.show(look.mode === 'fog');
    colored.show(look.mode === 'fog');
    for (const c of gui.controllersRecursive()) c.updateDisplay();
  };
  return { gui, update, show };
}

/** Of points. @param changed Called when the picture must be made anew. */
export function pointPanel(page, look, drawn, actions, changed) {
  const gui = new GUI({ title: page.title });
  gui.add(drawn, 'size', 0.25, 4, 0.05).onChange(changed);
  gui.addColor(look, 'backgroundColor').name('background').onChange(changed);
  gui.add(actions, 'screenshot');
  gui.add(actions, 'reset').name('reset camera');
  return { gui };
}

/** Orbit by one finger or the left button, pan by two or another button, zoom by wheel or two fingers. */
export function pointers(canvas, camera, moved) {
  const held = new Map();
  const aspect = () => canvas.clientWidth / canvas.clientHeight;
  canvas.addEventListener('pointerdown', (e) => {
    canvas.setPointerCapture(e.pointerId);
    held.set(e.pointerId, e);
    e.preventDefault();
  });
  for (const end of ['pointerup', 'pointercancel']) canvas.addEventListener(end, (e) => held.delete(e.pointerId));
  canvas.addEventListener('pointermove', (e) => {
    const before = held.get(e.pointerId);
    if (!before) return;
    const dx = (e.clientX - before.clientX) / canvas.clientHeight, dy = (e.clientY - before.clientY) / canvas.clientHeight;
    const others = [...held.values()].filter((o) => o.pointerId !== e.pointerId);
    if (others.length > 0) {
      const o = others[0], apart = (p) => Math.hypot(p.clientX - o.clientX, p.clientY - o.clientY);
      camera.zoom(Math.max(apart(before), 1) / Math.max(apart(e), 1));
      camera.pan(dx / 2, -dy / 2, aspect());
    } else if (e.buttons & 6 || e.shiftKey || e.ctrlKey) {
      camera.pan(dx, -dy, aspect());
    } else {
      camera.orbit(4 * dx, 4 * dy);
    }
    held.set(e.pointerId, e);
    moved();
  });
  canvas.addEventListener('wheel', (e) => {
    e.preventDefault();
    camera.zoom(Math.exp(Math.max(-200, Math.min(200, e.deltaY * (e.deltaMode ? 20 : 1))) * 0.0015));
    moved();
  }, { passive: false });
  canvas.addEventListener('contextmenu', (e) => e.preventDefault());
  canvas.addEventListener('dblclick', () => {
    camera.reset();
    moved();
  });
}
