// Three numbers, and affine maps of rows and a shift.

export const add = (a, b) => [a[0] + b[0], a[1] + b[1], a[2] + b[2]];
export const sub = (a, b) => [a[0] - b[0], a[1] - b[1], a[2] - b[2]];
export const mul = (a, s) => [a[0] * s, a[1] * s, a[2] * s];
export const dot = (a, b) => a[0] * b[0] + a[1] * b[1] + a[2] * b[2];
export const cross = (a, b) => [a[1] * b[2] - a[2] * b[1], a[2] * b[0] - a[0] * b[2], a[0] * b[1] - a[1] * b[0]];
export const length = (a) => Math.sqrt(dot(a, a));
export const normalized = (a) => mul(a, 1 / (length(a) || 1));
/** About a unit axis (Rodrigues' formula). */
export const turned = (v, axis, angle) => {
  const c = Math.cos(angle), s = Math.sin(angle);
  return add(add(mul(v, c), mul(cross(axis, v), s)), mul(axis, dot(axis, v) * (1 - c)));
};
export const vector = (rows, v) => rows.map((row) => dot(row, v));
/** @return The rows of the inverse. */
export const inverse = (rows) => {
  const [a, b, c] = [cross(rows[1], rows[2]), cross(rows[2], rows[0]), cross(rows[0], rows[1])];
  const d = 1 / dot(rows[0], a);
  return [0, 1, 2].map((n) => [a[n] * d, b[n] * d, c[n] * d]);
};
/** World length of what an axis of unit length becomes. */
export const edge = (rows, a) => Math.hypot(rows[0][a], rows[1][a], rows[2][a]);
