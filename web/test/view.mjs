// node view.mjs VLN MODULES FOLDER: pages in a browser of the volumes that tests/vln/ViewProgramTest.cpp puts into the
// folder, beside the pictures of `vln render`; then what the controls do.

import assert from 'node:assert/strict';
import { execFileSync } from 'node:child_process';
import { readFileSync } from 'node:fs';
import { join } from 'node:path';
import { decoded, openBrowser, openPage, pixels } from './browser.mjs';

const [program, modules, folder] = process.argv.slice(2);
const vln = (...args) => execFileSync(program, args, { stdio: ['ignore', 'pipe', 'pipe'], encoding: 'utf8' });
const SIZE = 128;

/** Mean over all pixels and channels, of 255; and the share of pixels that are far off. */
function difference(a, b) {
  assert.equal(a.data.length, b.data.length);
  let sum = 0, far = 0;
  for (let n = 0; n < a.data.length; n += 4) {
    let most = 0;
    for (let c = 0; c < 3; ++c) {
      const d = Math.abs(a.data[n + c] - b.data[n + c]);
      sum += d, most = Math.max(most, d);
    }
    far += most > 32;
  }
  const pixels = a.data.length / 4;
  return { mean: sum / pixels / 3, far: far / pixels };
}

const browser = await openBrowser(modules);
const failures = [];
async function test(name, body) {
  const began = Date.now();
  try {
    await body();
    console.log(`ok      ${name} (${Date.now() - began} ms)`);
  } catch (error) {
    failures.push(name);
    console.log(`FAILED  ${name}: ${error.stack}`);
  }
}

/** A page beside the picture of the same file with the same options. */
async function pageOf(file, options = []) {
  const out = join(folder, 'page.html');
  vln('view', file, '-o', out, ...options);
  return openPage(browser, out, SIZE, SIZE);
}
async function pictureOf(file, options) {
  const out = join(folder, 'picture.png');
  vln('render', file, '-o', out, '--size', `${SIZE}x${SIZE}`, ...options);
  return decoded(browser, readFileSync(out));
}
async function hidePanel(opened) {
  await opened.page.evaluate(() => globalThis.vlnView.panel.gui.hide());
}

const [cloud, torus, turned, egg, tiles, zeros] = ['cloud', 'torus', 'turned', 'egg', 'tiles', 'zeros'].map((n) => join(folder, n + '.vdb'));
const dots = join(folder, 'dots.ply');

// What both draw: [name, file, options, what it may differ by more]. What is left are codes of 8 bits, edges between
// pixels, and other random numbers; docs/viewing.md tells these bounds.
const MEAN = 2, FAR = 0.01;
const alike = [
  ['a fog', cloud, []],
  ['a coloured fog', cloud, ['--cmap', 'inferno', '--opacity', 'sigmoid', '--light', '-1,1,0']],
  ['a fog of its own opacity, by logarithms', cloud, ['--log', '--clim', '0.01,1', '--opacity', '0.01:0,0.3:0.8,1:0.2']],
  ['a level set', torus, []],
  ['a turned ramp, in colours', turned, ['--cmap', 'coolwarm']],
  ['a level set far away, of voxels that are no cubes', egg, []],
  ['zeros beside a surface', zeros, [], 2], // a plateau has no normals: both are noisy
  ['tiles of several depths', tiles, ['--channel', 'density']],
  ['an iso-surface', cloud, ['--iso', '0.4']],
  ['a projection', cloud, ['--mode', 'mip', '--clim', '0,1', '--cmap', 'turbo']],
  ['a mean', cloud, ['--mode', 'mean', '--clim', '0,0.3']],
];
for (const [name, file, options, more = 1] of alike)
  await test(`agrees with render: ${name}`, async () => {
    const opened = await pageOf(file, options);
    const drawn = await pixels(opened.page);
    const unit = await opened.page.evaluate(() => globalThis.vlnView.channel.unit);
    // Depths by size of pixels are the picture's alone.
    const picture = await pictureOf(file, [...options, '--depth', '28', '--spp', '8', ...(unit ? ['--opacity-unit', String(unit)] : [])]);
    const { mean: is, far: share } = difference(drawn, picture);
    console.log(`          mean ${is.toFixed(2)}, far ${(100 * share).toFixed(2)} %`);
    const empty = { data: drawn.data.map((v, n) => drawn.data[n % 4]) };
    assert.ok(difference(drawn, empty).mean > 2 * MEAN, 'the page is empty');
    assert.ok(is < more * MEAN && share < more * FAR, `mean ${is}, far ${share}`);
    assert.deepEqual(opened.faults, []);
    assert.deepEqual(opened.requests(), []);
    await opened.page.context().close();
  });

// What the controls do: each changes the picture by more than noise, and nothing goes wrong.
await test('controls change the picture', async () => {
  const out = join(folder, 'page.html');
  vln('view', tiles, '-o', out, '--channel', 'density', '--channel', 'other');
  const opened = await openPage(browser, out, SIZE, SIZE), { page } = opened;
  await page.waitForFunction(() => globalThis.vlnView?.renderer);
  await page.evaluate(() => globalThis.vlnView.renderer.most = 1);
  let last = await pixels(page);
  const changes = async (name, body) => {
    await body();
    await page.waitForTimeout(50);
    const next = await pixels(page);
    const { mean } = difference(last, next);
    assert.ok(mean > 0.5, `${name} changes nothing: ${mean}`);
    last = next;
  };
  const set = (name, value) => page.evaluate(([name, value]) => {
    const found = globalThis.vlnView.panel.gui.controllersRecursive().find((c) => c.property === name);
    found.setValue(value);
  }, [name, value]);
  await hidePanel(opened);
  await changes('a drag', async () => {
    await page.mouse.move(60, 60);
    await page.mouse.down();
    await page.mouse.move(90, 70, { steps: 3 });
    await page.mouse.up();
  });
  await changes('a drag of another button', async () => {
    await page.mouse.down({ button: 'right' });
    await page.mouse.move(70, 60, { steps: 3 });
    await page.mouse.up({ button: 'right' });
  });
  await changes('the wheel', () => page.mouse.wheel(0, -300));
  for (const [name, value] of [['logDensity', 0.7], ['depth', 26], ['slice', 'x'], ['slicePlace', 0.2], ['cut', true], ['slice', 'off'],
    ['colored', true], ['colors', 'turbo'], ['opacity', 'constant'], ['high', 0.8], ['mode', 'mip'], ['mode', 'surface'], ['iso', 0.2],
    ['channel', 'other'], ['backgroundColor', '#ffffff']])
    await changes(name, () => set(name, value));

  // The picture as a file, without the panel.
  const [download] = await Promise.all([page.waitForEvent('download'),
    page.evaluate(() => globalThis.vlnView.panel.gui.controllersRecursive().find((c) => c.property === 'screenshot').getValue()())]);
  assert.equal(download.suggestedFilename(), 'tiles.png');
  const saved = await decoded(browser, readFileSync(await download.path()));
  assert.equal(difference(saved, last).mean, 0);
  assert.deepEqual(opened.faults, []);
  assert.deepEqual(opened.requests(), []);
});

await test('a surface becomes a fog, and a slice', async () => {
  const opened = await pageOf(torus), { page } = opened;
  let last = await pixels(page);
  for (const [name, value] of [['mode', 'fog'], ['slice', 'y']]) {
    await page.evaluate(([name, value]) => {
      globalThis.vlnView.renderer.most = 1;
      globalThis.vlnView.panel.gui.controllersRecursive().find((c) => c.property === name).setValue(value);
    }, [name, value]);
    await page.waitForTimeout(50);
    const next = await pixels(page);
    assert.ok(difference(last, next).mean > 0.5, name);
    last = next;
  }
  assert.deepEqual(opened.faults, []);
});

// Fingers, as the browser's own machinery makes events of them.
await test('one finger orbits, two zoom and pan', async () => {
  const opened = await pageOf(torus), { page } = opened;
  await pixels(page);
  const cdp = await page.context().newCDPSession(page);
  await cdp.send('Emulation.setTouchEmulationEnabled', { enabled: true, maxTouchPoints: 2 });
  const touch = (type, ...fingers) =>
    cdp.send('Input.dispatchTouchEvent', { type, touchPoints: fingers.map(([x, y], id) => ({ x, y, id })) });
  const camera = () => page.evaluate(() => {
    const { forward, distance, focalPoint } = globalThis.vlnView.camera;
    return { forward, distance, focalPoint };
  });
  const apart = (a, b) => Math.hypot(...a.map((v, n) => v - b[n]));
  const gesture = async (from, to) => {
    const before = await camera();
    await touch('touchStart', ...from);
    for (let s = 1; s <= 4; ++s)
      await touch('touchMove', ...from.map((p, n) => p.map((v, a) => v + (to[n][a] - v) * s / 4)));
    await touch('touchEnd');
    await page.waitForTimeout(50);
    const after = await camera();
    return { turned: apart(before.forward, after.forward), zoom: after.distance / before.distance,
      moved: apart(before.focalPoint, after.focalPoint) / before.distance };
  };
  await hidePanel(opened);
  const one = await gesture([[50, 60]], [[90, 70]]);
  assert.ok(one.turned > 0.2 && Math.abs(one.zoom - 1) < 1e-9 && one.moved < 1e-9, JSON.stringify(one));
  const spread = await gesture([[54, 64], [74, 64]], [[34, 64], [94, 64]]);
  assert.ok(spread.turned < 1e-9 && spread.zoom < 0.5 && spread.moved < 0.05, JSON.stringify(spread));
  const pinch = await gesture([[34, 64], [94, 64]], [[54, 64], [74, 64]]);
  assert.ok(pinch.zoom > 2 && pinch.moved < 0.2, JSON.stringify(pinch));
  const pan = await gesture([[40, 40], [60, 40]], [[70, 70], [90, 70]]);
  assert.ok(pan.turned < 1e-9 && Math.abs(pan.zoom - 1) < 0.6 && pan.moved > 0.05, JSON.stringify(pan));
  assert.deepEqual(opened.faults, []);
  await page.context().close();
});

await test('points', async () => {
  const opened = await pageOf(dots), { page } = opened;
  const first = await pixels(page);
  const picture = await pictureOf(dots, []);
  const { mean, far } = difference(first, picture);
  console.log(`          mean ${mean.toFixed(2)}, far ${(100 * far).toFixed(2)} %`);
  // Other discs at the same places: their edges and shades differ, not where they are and what colour they have.
  assert.ok(mean < 12, `mean ${mean}`);
  const empty = { data: first.data.map((v, n) => first.data[n % 4]) };
  assert.ok(difference(first, empty).mean > 12, 'the page is empty');
  await hidePanel(opened);
  await page.mouse.move(60, 60);
  await page.mouse.down();
  await page.mouse.move(90, 70, { steps: 3 });
  await page.mouse.up();
  await page.waitForTimeout(50);
  const turned = await pixels(page);
  assert.ok(difference(first, turned).mean > 0.5, 'a drag changes nothing');
  await page.evaluate(() => globalThis.vlnView.panel.gui.controllersRecursive().find((c) => c.property === 'size').setValue(0.25));
  await page.waitForTimeout(50);
  assert.ok(difference(turned, await pixels(page)).mean > 0.5, 'their size changes nothing');
  assert.deepEqual(opened.faults, []);
  assert.deepEqual(opened.requests(), []);
  await page.context().close();
});

await browser.close();
if (failures.length > 0) process.exitCode = 1;
