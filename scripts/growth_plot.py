"""growth_plot.py OUT.svg RESULT...: time and memory for each voxel against the number of voxels, as a picture, and
the fitted exponents as a table in Markdown. RESULT are lines of JSON as bench/growth writes them.
"""

import json
import math
import sys

COLORS = ["#4363d8", "#e6194b", "#3cb44b", "#f58231", "#911eb4", "#008080"]
WIDTH, HEIGHT, LEFT, TOP = 460, 320, 64, 40


def read(paths):
    steps = {}
    for path in paths:
        with open(path, encoding="utf-8") as file:
            for line in file:
                row = json.loads(line)
                steps.setdefault(row["step"], []).append((row["voxels"], row["seconds"], row["bytes"]))
    return {step: sorted(rows) for step, rows in steps.items()}


def exponent(points):
    """Slope of the least squares line through the logarithms: 1 is linear."""
    points = [(math.log(x), math.log(y)) for x, y in points if y > 0]
    if len(points) < 2:
        return None
    mx, my = (sum(p[i] for p in points) / len(points) for i in (0, 1))
    spread = sum((x - mx) ** 2 for x, _ in points)
    return sum((x - mx) * (y - my) for x, y in points) / spread


def decades(values):
    return math.floor(math.log10(min(values))), math.ceil(math.log10(max(values)))


def chart(title, unit, series, x0):
    """Both axes by powers of ten."""
    xs = [x for points in series.values() for x, _ in points]
    ys = [y for points in series.values() for _, y in points if y > 0]
    (xl, xh), (yl, yh) = decades(xs), decades(ys)
    xh, yh = max(xh, xl + 1), max(yh, yl + 1)
    w, h = WIDTH - LEFT - 20, HEIGHT - TOP - 40
    px = lambda x: x0 + LEFT + (math.log10(x) - xl) / (xh - xl) * w
    py = lambda y: TOP + h - (math.log10(y) - yl) / (yh - yl) * h
    out = [f'<text x="{x0 + LEFT}" y="24" font-size="14" font-weight="bold">{title}</text>']
    for d in range(xl, xh + 1):
        out.append(f'<path d="M{px(10 ** d):.1f} {TOP}V{TOP + h}" stroke="#ddd"/>')
        out.append(f'<text x="{px(10 ** d):.1f}" y="{TOP + h + 18}" text-anchor="middle">10<tspan dy="-5" '
                   f'font-size="9">{d}</tspan></text>')
    for d in range(yl, yh + 1):
        out.append(f'<path d="M{x0 + LEFT} {py(10 ** d):.1f}h{w}" stroke="#ddd"/>')
        out.append(f'<text x="{x0 + LEFT - 6}" y="{py(10 ** d) + 4:.1f}" text-anchor="end">{10 ** d:g}</text>')
    out.append(f'<text x="{x0 + LEFT + w / 2}" y="{TOP + h + 34}" text-anchor="middle">active voxels</text>')
    out.append(f'<text transform="translate({x0 + 16} {TOP + h / 2}) rotate(-90)" '
               f'text-anchor="middle">{unit}</text>')
    for color, points in zip(COLORS, series.values()):
        points = [(px(x), py(y)) for x, y in points if y > 0]
        if not points:
            continue
        out.append(f'<polyline points="{" ".join(f"{x:.1f},{y:.1f}" for x, y in points)}" fill="none" '
                   f'stroke="{color}" stroke-width="2"/>')
        out += [f'<circle cx="{x:.1f}" cy="{y:.1f}" r="3" fill="{color}"/>' for x, y in points]
    return out


def main():
    out, steps = sys.argv[1], read(sys.argv[2:])
    if not steps:
        print("growth: no result", file=sys.stderr)
        return 1
    times = {s: [(v, t / v * 1e9) for v, t, _ in rows] for s, rows in steps.items()}
    bytes_ = {s: [(v, max(b, 1) / v) for v, _, b in rows] for s, rows in steps.items()}
    # What takes next to no memory is left out of that picture.
    bytes_ = {s: [(v, b if b >= 0.01 else 0) for v, b in rows] for s, rows in bytes_.items()}
    body = chart("Time", "ns for each voxel", times, 0) + chart("Memory gained", "bytes for each voxel", bytes_, WIDTH)
    for n, (color, step) in enumerate(zip(COLORS, steps)):
        x = LEFT + n * 140
        body.append(f'<rect x="{x}" y="{HEIGHT}" width="12" height="12" fill="{color}"/>')
        body.append(f'<text x="{x + 18}" y="{HEIGHT + 11}">{step}</text>')
    with open(out, "w", encoding="utf-8") as file:
        file.write(f'<svg xmlns="http://www.w3.org/2000/svg" width="{2 * WIDTH}" height="{HEIGHT + 24}" '
                   f'font-family="sans-serif" font-size="12"><rect width="100%" height="100%" fill="white"/>\n')
        file.write("\n".join(body) + "\n</svg>\n")
    sizes = sorted({v for rows in steps.values() for v, _, _ in rows})
    print("| step | " + " | ".join(f"{v / 1e6:.3g} M: ns, bytes a voxel" for v in sizes) +
          " | exponent of time | of memory |")
    print("|---" + "|---:" * (len(sizes) + 2) + "|")
    for step, rows in steps.items():
        found = {v: (t / v * 1e9, b / v) for v, t, b in rows}
        cells = [f"{found[v][0]:.3g}, {found[v][1]:.3g}" if v in found else "" for v in sizes]
        fits = [exponent([(v, t) for v, t, _ in rows]),
                exponent([(v, b) for v, _, b in rows if b / v >= 0.01])]
        print(f"| {step} | " + " | ".join(cells + ["" if f is None else f"{f:.2f}" for f in fits]) + " |")
    return 0


if __name__ == "__main__":
    sys.exit(main())
