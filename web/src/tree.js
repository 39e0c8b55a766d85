// The bricks of a depth in a tree of nodes of 4^3 entries, and values at places.
//
//   entry   0: nothing    1 << 30 | node    2 << 30 | brick

export const NODE = 1, BRICK = 2;
const INDEX = 0x3fffffff;
const WIDTH = 9, LAYER = 81, SAMPLES = 729;

export class Tree {
  constructor(level, bricks, background) {
    this.levels = level.levels;
    this.origin = level.origin;
    this.spacing = level.spacing;
    this.depth = level.depth;
    this.bricks = bricks;
    this.background = background;
    // Bricks of one value share the slot behind all others.
    this.slots = bricks.codes.length / SAMPLES;
    this.slot = new Uint32Array(bricks.count);
    for (let n = 0, next = 0; n < bricks.count; ++n)
      this.slot[n] = bricks.low[n] < bricks.high[n] ? next++ : this.slots;

    let nodes = 1, entries = new Uint32Array(1024);
    for (let n = 0; n < bricks.count; ++n) {
      const own = bricks.level[n];
      let node = 0;
      for (let l = this.levels - 1; l >= own; --l) {
        const s = 2 * (l - own);
        const i = 64 * node + ((bricks.x[n] >>> s) & 3) + 4 * ((bricks.y[n] >>> s) & 3) + 16 * ((bricks.z[n] >>> s) & 3);
        if (l === own) {
          entries[i] = (BRICK << 30 | n) >>> 0;
        } else {
          if (entries[i] === 0) {
            if (64 * (nodes + 1) > entries.length) {
              const more = new Uint32Array(2 * entries.length);
              more.set(entries);
              entries = more;
            }
            entries[i] = NODE << 30 | nodes++;
          }
          node = entries[i] & INDEX;
        }
      }
    }
    this.nodes = nodes;
    this.entries = entries.subarray(0, 64 * nodes);
  }

  /** The entries of those bricks alone that matter, each told by its range of values. */
  visible(matters) {
    const out = new Uint32Array(this.entries.length);
    // Nodes have larger numbers than those that hold them.
    for (let node = this.nodes; node-- > 0;)
      for (let i = 64 * node; i < 64 * node + 64; ++i) {
        const e = this.entries[i], index = e & INDEX;
        if (e >>> 30 === BRICK) {
          if (matters(this.bricks.low[index], this.bricks.high[index])) out[i] = e;
        } else if (e !== 0) {
          for (let c = 64 * index; c < 64 * index + 64; ++c)
            if (out[c] !== 0) {
              out[i] = e;
              break;
            }
        }
      }
    return out;
  }

  /** The blend at a place, in samples from the origin; none where there is no brick. */
  value(x, y, z) {
    const cx = Math.floor(x), cy = Math.floor(y), cz = Math.floor(z);
    const whole = 8 * 4 ** this.levels;
    if (!(cx >= 0 && cy >= 0 && cz >= 0 && cx < whole && cy < whole && cz < whole)) return undefined;
    let node = 0;
    for (let l = this.levels - 1; l >= 0; --l) {
      const s = 3 + 2 * l;
      const e = this.entries[64 * node + ((cx >> s) & 3) + 4 * ((cy >> s) & 3) + 16 * ((cz >> s) & 3)];
      if (e === 0) return undefined;
      const index = e & INDEX;
      if (e >>> 30 === NODE) {
        node = index;
        continue;
      }
      const low = this.bricks.low[index], range = this.bricks.high[index] - low;
      if (range === 0) return low;
      const scale = 1 / (1 << 2 * l), mask = (1 << s) - 1;
      const u = ((cx & mask) + x - cx) * scale, v = ((cy & mask) + y - cy) * scale, w = ((cz & mask) + z - cz) * scale;
      const i = Math.floor(u), j = Math.floor(v), k = Math.floor(w), fx = u - i, fy = v - j, fz = w - k;
      const c = this.bricks.codes, at = SAMPLES * this.slot[index] + LAYER * k + WIDTH * j + i;
      const row = (a) => c[a] + (c[a + 1] - c[a]) * fx;
      const layer = (a) => {
        const r = row(a);
        return r + (row(a + WIDTH) - r) * fy;
      };
      const near = layer(at);
      return low + range / 255 * (near + (layer(at + LAYER) - near) * fz);
    }
    return undefined;
  }
}
