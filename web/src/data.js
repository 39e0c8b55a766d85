// What the page holds: a description, and blocks of numbers packed by gzip in base64.

export function about() {
  return JSON.parse(document.getElementById('about').textContent);
}

/** The bytes of a block; the text is dropped from the page. */
export async function unpack(number) {
  const element = document.getElementById('block' + number);
  const text = atob(element.textContent);
  element.remove();
  const bytes = new Uint8Array(text.length);
  for (let n = 0; n < text.length; ++n) bytes[n] = text.charCodeAt(n);
  const stream = new Blob([bytes]).stream().pipeThrough(new DecompressionStream('gzip'));
  return new Response(stream).arrayBuffer();
}

/** The bricks of a depth, part by part: see Bricks.h and packedLevel() of View.cpp. */
export function bricksOf(level, buffer) {
  const n = level.bricks;
  const integers = (part) => new Uint32Array(buffer, 4 * part * n, n);
  const floats = (part) => new Float32Array(buffer, 4 * part * n, n);
  const codes = new Uint8Array(buffer, 24 * n);
  for (let at = 0; at < codes.length; at += 9) // differences along a row
    for (let i = at + 1; i < at + 9; ++i) codes[i] += codes[i - 1];
  return {
    count: n,
    x: integers(0), y: integers(1), z: integers(2), level: integers(3),
    low: floats(4), high: floats(5),
    codes,
  };
}

/** Colour maps (256 x 3 of linear light) and opacities (256) by name: see tables() of View.cpp. */
export function tablesOf(page, buffer) {
  const colors = {}, opacities = {};
  let at = 0;
  for (const name of page.colorMaps) colors[name] = new Float32Array(buffer, at, 768), at += 4 * 768;
  for (const name of page.opacities) opacities[name] = new Float32Array(buffer, at, 256), at += 4 * 256;
  return { colors, opacities };
}
