"""Draws scale-bench's values as one SVG: the cost of a message by each growing number.

Usage: plot.py VALUES.csv PICTURE.svg
"""

import csv
import math
import sys

WIDTH, HEIGHT, LEFT, TOP, PLOT_WIDTH, PLOT_HEIGHT = 980, 250, 60, 34, 130, 160
TITLES = {"clients": "clients", "sessions": "sessions of one client", "history": "messages in a history",
          "keys": "keys of a payload", "broadcast": "sessions reached, per row"}


def main(values, picture):
    with open(values, newline="") as file:
        rows = list(csv.DictReader(file))
    sweeps = [name for name in TITLES if any(row["sweep"] == name for row in rows)]
    out = [f'<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 {WIDTH} {HEIGHT}" '
           'font-family="sans-serif" font-size="11" fill="#333">',
           f'<rect width="{WIDTH}" height="{HEIGHT}" fill="#fff"/>',
           f'<text x="12" y="{TOP - 16}">CPU microseconds a message, socket to store</text>']
    for place, name in enumerate(sweeps):
        points = [(int(row["size"]), float(row["processor_us_per_message"]))
                  for row in rows if row["sweep"] == name]
        left = LEFT + place * (PLOT_WIDTH + 52)
        low, high = math.log10(points[0][0]), math.log10(points[-1][0])
        top = max(value for _, value in points) * 1.2

        def at(size, value):
            along = (math.log10(size) - low) / ((high - low) or 1)
            return left + along * PLOT_WIDTH, TOP + PLOT_HEIGHT * (1 - value / top)

        bottom = TOP + PLOT_HEIGHT
        out.append(f'<path d="M{left} {TOP}V{bottom}H{left + PLOT_WIDTH}" fill="none" stroke="#999"/>')
        for value in (0, top / 2, top):
            y = at(points[0][0], value)[1]
            out.append(f'<text x="{left - 4}" y="{y + 4:.1f}" text-anchor="end">{value:.1f}</text>')
        for size, _ in (points[0], points[-1]):
            x = at(size, 0)[0]
            out.append(f'<text x="{x:.1f}" y="{bottom + 14}" text-anchor="middle">{size:,}</text>')
        line = " ".join(f"{x:.1f},{y:.1f}" for x, y in (at(*point) for point in points))
        out.append(f'<polyline points="{line}" fill="none" stroke="#1f6feb" stroke-width="2"/>')
        for point in points:
            x, y = at(*point)
            out.append(f'<circle cx="{x:.1f}" cy="{y:.1f}" r="3" fill="#1f6feb">'
                       f"<title>{point[0]:,}: {point[1]:.2f} us</title></circle>")
        out.append(f'<text x="{left + PLOT_WIDTH / 2}" y="{bottom + 32}" text-anchor="middle">'
                   f"{TITLES[name]}</text>")
    out.append("</svg>")
    with open(picture, "w") as file:
        file.write("\n".join(out) + "\n")


if __name__ == "__main__":
    if len(sys.argv) != 3:
        sys.exit(__doc__)
    main(*sys.argv[1:])
