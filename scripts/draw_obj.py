#!/usr/bin/env python3
"""Draws box files, such as `vln tiles` writes, side by side into a .png file.

usage: draw_obj.py OUT.png FILE.obj [FILE.obj ...]

Every face is a parallelogram of the material before it, whose colours are read from the material file. The
view is parallel, from above and to the side; nothing but the standard library is needed.
"""
import math
import os
import struct
import sys
import zlib

PANEL, SAMPLES = 480, 2
VIEW, UP, LIGHT = (0.75, 0.45, -1.0), (0.0, 1.0, 0.0), (0.5, 0.9, -0.3)


def dot(a, b):
    return a[0] * b[0] + a[1] * b[1] + a[2] * b[2]


def cross(a, b):
    return (a[1] * b[2] - a[2] * b[1], a[2] * b[0] - a[0] * b[2], a[0] * b[1] - a[1] * b[0])


def unit(a):
    length = math.sqrt(dot(a, a)) or 1.0
    return (a[0] / length, a[1] / length, a[2] / length)


def read_materials(path):
    colours = {}
    with open(path) as lines:
        for words in map(str.split, lines):
            if words[:1] == ["newmtl"]:
                name = words[1]
            elif words[:1] == ["Kd"]:
                colours[name] = tuple(map(float, words[1:4]))
    return colours


def read_boxes(path):
    vertices, faces, colours, colour = [], [], {}, (0.8, 0.8, 0.8)
    with open(path) as lines:
        for words in map(str.split, lines):
            if words[:1] == ["v"]:
                vertices.append(tuple(map(float, words[1:4])))
            elif words[:1] == ["mtllib"]:
                colours = read_materials(os.path.join(os.path.dirname(path), words[1]))
            elif words[:1] == ["usemtl"]:
                colour = colours.get(words[1], colour)
            elif words[:1] == ["f"]:
                faces.append((tuple(int(w) - 1 for w in words[1:5]), colour))
    return vertices, faces


def draw(path, size):
    vertices, faces = read_boxes(path)
    if not vertices:
        sys.exit(f"draw_obj: {path} has no boxes")
    back = unit(VIEW)
    right = unit(cross(UP, back))
    up = cross(back, right)
    light = unit(LIGHT)
    seen = [(dot(v, right), -dot(v, up), dot(v, back)) for v in vertices]
    low = [min(p[a] for p in seen) for a in (0, 1)]
    extent = max(max(p[a] for p in seen) - low[a] for a in (0, 1))
    scale = 0.92 * size / extent
    shift = [(size - scale * (max(p[a] for p in seen) - low[a])) / 2 for a in (0, 1)]
    seen = [((p[0] - low[0]) * scale + shift[0], (p[1] - low[1]) * scale + shift[1], p[2] * scale) for p in seen]
    pixels, depths = [(1.0, 1.0, 1.0)] * (size * size), [-math.inf] * (size * size)
    for corners, colour in faces:
        p, q, r = (seen[corners[n]] for n in (0, 1, 3))
        a, b = [q[n] - p[n] for n in range(3)], [r[n] - p[n] for n in range(3)]
        area = a[0] * b[1] - a[1] * b[0]
        if abs(area) < 1e-9:
            continue
        world = [vertices[corners[n]] for n in (0, 1, 3)]
        normal = unit(cross(*[[w[n] - world[0][n] for n in range(3)] for w in world[1:]]))
        if dot(normal, back) < 0:
            normal = tuple(-c for c in normal)
        shade = 0.45 + 0.55 * max(0.0, dot(normal, light))
        fill, edge = tuple(c * shade for c in colour), tuple(c * shade * 0.55 for c in colour)
        thick = [0.9 * SAMPLES / 2 * math.hypot(*s[:2]) / abs(area) for s in (b, a)]
        xs = [p[0], q[0], r[0], q[0] + b[0]]
        ys = [p[1], q[1], r[1], q[1] + b[1]]
        for y in range(max(0, math.floor(min(ys))), min(size, math.ceil(max(ys)) + 1)):
            for x in range(max(0, math.floor(min(xs))), min(size, math.ceil(max(xs)) + 1)):
                dx, dy = x + 0.5 - p[0], y + 0.5 - p[1]
                u, v = (dx * b[1] - dy * b[0]) / area, (a[0] * dy - a[1] * dx) / area
                if not (0 <= u <= 1 and 0 <= v <= 1):
                    continue
                z, at = p[2] + u * a[2] + v * b[2], y * size + x
                if z > depths[at]:
                    depths[at] = z
                    pixels[at] = edge if min(u, 1 - u) < thick[0] or min(v, 1 - v) < thick[1] else fill
    return pixels


def main(arguments):
    if len(arguments) < 2:
        sys.exit(__doc__)
    size = PANEL * SAMPLES
    panels = [draw(path, size) for path in arguments[1:]]
    rows = bytearray()
    for y in range(PANEL):
        rows.append(0)
        for panel in panels:
            for x in range(PANEL):
                box = [panel[(y * SAMPLES + j) * size + x * SAMPLES + i] for j in range(SAMPLES) for i in range(SAMPLES)]
                rows += bytes(round(255 * min(1.0, sum(c[n] for c in box) / len(box))) for n in range(3))

    def chunk(kind, data):
        return struct.pack(">I", len(data)) + kind + data + struct.pack(">I", zlib.crc32(kind + data))

    header = struct.pack(">IIBBBBB", PANEL * len(panels), PANEL, 8, 2, 0, 0, 0)
    with open(arguments[0], "wb") as out:
        out.write(b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", header) + chunk(b"IDAT", zlib.compress(bytes(rows), 9)) +
                  chunk(b"IEND", b""))


if __name__ == "__main__":
    main(sys.argv[1:])
