// Where the page looks from. The picture of a square window is that of `vln render`.

import { add, cross, dot, length, mul, normalized, sub, turned } from './vec.js';

export class Camera {
  constructor(first) {
    this.first = first;
    this.reset();
  }
  reset() {
    this.focalPoint = this.first.focalPoint;
    this.viewUp = this.first.viewUp;
    this.angle = this.first.viewAngle * Math.PI / 180;
    this.distance = length(sub(this.first.focalPoint, this.first.position));
    this.forward = normalized(sub(this.first.focalPoint, this.first.position));
  }
  get position() {
    return sub(this.focalPoint, mul(this.forward, this.distance));
  }
  get right() {
    return normalized(cross(this.forward, this.viewUp));
  }
  get up() {
    return cross(this.right, this.forward);
  }
  /** Half of the height and of the width of the picture at distance 1: a narrow window shows more above and below. */
  halves(aspect) {
    const half = Math.tan(this.angle / 2);
    return aspect < 1 ? [half / aspect, half] : [half, half * aspect];
  }

  orbit(right, up) {
    this.forward = normalized(turned(this.forward, this.viewUp, -right));
    const next = normalized(turned(this.forward, this.right, up));
    if (Math.abs(dot(next, this.viewUp)) < 0.999) this.forward = next;
  }
  zoom(factor) {
    this.distance = Math.max(this.distance * factor, 1e-9 * (1 + length(this.focalPoint)));
  }
  /** By shares of the picture's height. */
  pan(right, up, aspect) {
    const size = 2 * this.halves(aspect)[0] * this.distance;
    this.focalPoint = add(this.focalPoint, add(mul(this.right, -right * size), mul(this.up, -up * size)));
  }
}
