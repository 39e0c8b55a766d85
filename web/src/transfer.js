// From values to colour and opacity, as src/Render/Transfer.cpp has it, whose tables the page brings.

export const SIZE = 256;

export class Transfer {
  /** @param o range, log, colors, opacity, awayFrom; own: the table of an opacity that has no name, and its range. */
  constructor(tables, o) {
    let [low, high] = o.range;
    if (!(low < high)) high = low + Math.max(1e-6, 1e-6 * Math.abs(low));
    this.log = o.log && high > 0;
    if (this.log && !(low > 0)) low = high * 1e-3;
    this.low = this.log ? Math.log(low) : low;
    this.scale = 1 / ((this.log ? Math.log(high) : high) - this.low);
    this.opacity = new Float32Array(SIZE);
    const named = tables.opacities[o.opacity];
    const farthest = Math.max(Math.abs(low - o.awayFrom), Math.abs(high - o.awayFrom));
    for (let n = 0; n < SIZE; ++n) {
      const inside = this.low + n / (SIZE - 1) / this.scale, value = this.log ? Math.exp(inside) : inside;
      if (!named) this.opacity[n] = at(o.own.table, new Place(o.own).of(value));
      else if (o.awayFrom === undefined) this.opacity[n] = named[n];
      else this.opacity[n] = at(named, Math.min(1, Math.abs(value - o.awayFrom) / farthest));
    }
    this.texels = new Float32Array(4 * SIZE);
    const colors = tables.colors[o.colors];
    for (let n = 0; n < SIZE; ++n) {
      for (let c = 0; c < 3; ++c) this.texels[4 * n + c] = colors[3 * n + c];
      this.texels[4 * n + 3] = this.opacity[n];
    }
  }

  place(value) {
    const t = ((this.log ? Math.log(Math.max(value, 1e-30)) : value) - this.low) * this.scale;
    return t > 0 ? Math.min(t, 1) : 0;
  }
  opacityAt(value) {
    return at(this.opacity, this.place(value));
  }
  /** Whether any value between two has an opacity. */
  shows(low, high) {
    const last = Math.ceil(this.place(high) * (SIZE - 1));
    for (let n = Math.floor(this.place(low) * (SIZE - 1)); n <= last; ++n) if (this.opacity[n] > 0) return true;
    return false;
  }
}

class Place {
  constructor({ range, log }) {
    this.log = log, this.low = log ? Math.log(range[0]) : range[0], this.high = log ? Math.log(range[1]) : range[1];
  }
  of(value) {
    return Math.min(1, Math.max(0, ((this.log ? Math.log(value) : value) - this.low) / (this.high - this.low)));
  }
}

function at(table, t) {
  const x = t * (SIZE - 1), n = Math.floor(x), m = Math.min(n + 1, SIZE - 1);
  return table[n] + (table[m] - table[n]) * (x - n);
}
