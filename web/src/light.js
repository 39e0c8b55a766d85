// Light that reaches the points of a coarse lattice, plane by plane: the sweep of src/Render/LightLattice.cpp.

import { edge } from './vec.js';

/** A lattice over the box of a field of at most `most` points along its longest axis. */
export class Lattice {
  constructor(tree, box, rows, most) {
    const extent = [0, 1, 2].map((a) => box.high[a] - box.low[a]);
    const longest = Math.max(...extent.map((e, a) => e * edge(rows, a)));
    this.low = box.low;
    this.size = extent.map((e, a) => 1 + Math.max(1, Math.ceil(e / Math.max(1, longest / most / edge(rows, a)))));
    this.scale = extent.map((e, a) => (this.size[a] - 1) / e);
    const [nx, ny, nz] = this.size;
    // Values once; what they weigh changes.
    this.values = new Float32Array(nx * ny * nz).fill(NaN);
    for (let k = 0, at = 0; k < nz; ++k)
      for (let j = 0; j < ny; ++j)
        for (let i = 0; i < nx; ++i, ++at) {
          const v = tree.value((box.low[0] + i / this.scale[0] - tree.origin[0]) / tree.spacing,
            (box.low[1] + j / this.scale[1] - tree.origin[1]) / tree.spacing,
            (box.low[2] + k / this.scale[2] - tree.origin[2]) / tree.spacing);
          if (v !== undefined) this.values[at] = v;
        }
  }

  weigh(transfer, perUnit) {
    this.extinctions = new Float32Array(this.values.length);
    for (let n = 0; n < this.values.length; ++n)
      if (this.values[n] === this.values[n]) this.extinctions[n] = transfer.opacityAt(this.values[n]) * perUnit;
  }

  /** @param toLight Local; a world length of 1. @return What share of the light arrives at each point. */
  sweep(toLight) {
    const size = this.size, light = new Float32Array(this.values.length).fill(1);
    const d = toLight.map((v, a) => v * this.scale[a]);
    let axis = 0;
    for (let a = 1; a < 3; ++a) if (Math.abs(d[a]) > Math.abs(d[axis])) axis = a;
    const b = (axis + 1) % 3, c = (axis + 2) % 3;
    const toPlane = 1 / Math.abs(d[axis]), up = d[axis] > 0;
    const stride = [1, size[0], size[0] * size[1]];
    const e = this.extinctions;
    for (let n = 1; n < size[axis]; ++n) {
      const plane = up ? size[axis] - 1 - n : n, before = (up ? plane + 1 : plane - 1) * stride[axis];
      // The step to the plane before is the same for all points.
      const sy = d[b] * toPlane, sz = d[c] * toPlane, dy = Math.floor(sy), dz = Math.floor(sz);
      const fy = sy - dy, fz = sz - dz;
      for (let k = 0; k < size[c]; ++k)
        for (let j = 0; j < size[b]; ++j) {
          let lit = 0, thick = 0;
          for (let corner = 0; corner < 4; ++corner) {
            const y = j + dy + (corner & 1), z = k + dz + (corner >> 1);
            const w = (corner & 1 ? fy : 1 - fy) * (corner >> 1 ? fz : 1 - fz);
            if (y < 0 || z < 0 || y >= size[b] || z >= size[c]) {
              lit += w;
              continue;
            }
            const at = before + y * stride[b] + z * stride[c];
            lit += w * light[at], thick += w * e[at];
          }
          const here = plane * stride[axis] + j * stride[b] + k * stride[c];
          light[here] = lit * Math.exp(-0.5 * (thick + e[here]) * toPlane);
        }
    }
    return light;
  }
}
