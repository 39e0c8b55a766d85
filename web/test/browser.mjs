// Debian's Chromium without a screen, and pages of `vln view` in it.

import { createRequire } from 'node:module';
import { pathToFileURL } from 'node:url';

/** @param modules The folder that holds node_modules. */
export async function openBrowser(modules) {
  const { chromium } = createRequire(modules + '/')('playwright-core');
  return chromium.launch({
    executablePath: process.env.VLN_CHROMIUM || '/usr/bin/chromium',
    args: ['--no-sandbox', '--use-angle=swiftshader', '--enable-unsafe-swiftshader'],
  });
}

/** A page whose faults and requests are kept. */
export async function openPage(browser, file, width, height) {
  const context = await browser.newContext({ viewport: { width, height }, acceptDownloads: true });
  const page = await context.newPage();
  const faults = [], requests = [];
  page.on('pageerror', (e) => faults.push(String(e)));
  page.on('console', (m) => ['error', 'warning'].includes(m.type()) && !/GPU stall/.test(m.text()) && faults.push(m.text()));
  page.on('request', (r) => requests.push(r.url()));
  const url = pathToFileURL(file).href;
  await page.goto(url);
  return { page, faults, requests: () => requests.filter((r) => r !== url && !r.startsWith('blob:') && !r.startsWith('data:')) };
}

/** Waits until the picture is as fine as it gets. */
export async function settled(page) {
  await page.waitForFunction(() => document.querySelector('canvas')?.dataset.done > 0, null, { timeout: 90000 });
}

/** RGBA of the picture, from the top. */
export async function pixels(page) {
  await settled(page);
  return page.evaluate(() => {
    const { renderer, canvas } = globalThis.vlnView, gl = renderer.gl;
    renderer.present(renderer.presented);
    const { width, height } = canvas, bytes = new Uint8Array(4 * width * height);
    gl.readPixels(0, 0, width, height, gl.RGBA, gl.UNSIGNED_BYTE, bytes);
    const rows = [];
    for (let y = height; y-- > 0;) rows.push(...bytes.subarray(4 * width * y, 4 * width * (y + 1)));
    return { width, height, data: rows };
  });
}

/** RGBA of a PNG file, decoded by the browser. */
export async function decoded(browser, bytes) {
  const context = await browser.newContext(), page = await context.newPage();
  const out = await page.evaluate(async (text) => {
    const image = new Image();
    image.src = 'data:image/png;base64,' + text;
    await image.decode();
    const canvas = document.createElement('canvas');
    canvas.width = image.width, canvas.height = image.height;
    const draw = canvas.getContext('2d');
    draw.drawImage(image, 0, 0);
    return { width: image.width, height: image.height, data: [...draw.getImageData(0, 0, image.width, image.height).data] };
  }, bytes.toString('base64'));
  await context.close();
  return out;
}
