"""Measures the export for growing numbers of devices: runs fleet-bench against a cluster of three nodes for
each number, prints a table, and with --svg draws the table. `bench/fleet.py BUILD [DEVICES ...] [--rows N]
[--svg FILE]`; the numbers default to 10 20 50 100 200 500."""

import argparse
import json
import pathlib
import resource
import subprocess
import sys
import tempfile

sys.path[:0] = [str(pathlib.Path(__file__).parents[1] / "tests" / name) for name in ("export", "integration")]
from cluster import Cluster

MEMORY = pathlib.Path("/dev/shm")  # in memory, so that the medium does not limit the result


def cpu_of(process):
    fields = pathlib.Path(f"/proc/{process.pid}/stat").read_text().rsplit(")", 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / 100


def measured(build, devices, rows):
    resource.setrlimit(resource.RLIMIT_NOFILE, (resource.getrlimit(resource.RLIMIT_NOFILE)[1],) * 2)
    cluster = Cluster()
    try:
        cluster.create_stream()
        with tempfile.TemporaryDirectory(dir=MEMORY if MEMORY.is_dir() else None) as directory:
            before = sum(map(cpu_of, cluster.nodes))
            ran = subprocess.run([build / "bench/fleet-bench", directory, str(devices), str(rows), *cluster.urls],
                                 capture_output=True, text=True, check=False, timeout=900)
            if ran.returncode != 0:
                sys.exit(f"fleet-bench failed: {ran.stderr}")
            result = json.loads(ran.stdout)
            store = next(pathlib.Path(directory).glob("*.db"))
            written = store.stat().st_size + pathlib.Path(f"{store}-wal").stat().st_size
        state = cluster.state()
        if state["messages"] != devices * rows:
            sys.exit(f"the stream holds {state['messages']} of {devices * rows} rows")
        result["engine_cpu_us_per_row"] = round((sum(map(cpu_of, cluster.nodes)) - before) * 1e6 / (devices * rows), 1)
        result["stream_bytes_per_row"] = round(state["bytes"] / state["messages"], 1)
        result["store_bytes_per_row"] = round(written / rows, 1)
        return result
    finally:
        cluster.close()


def drawn(results):
    """The drawing: rows per second of the fleet, and the devices' CPU time per row, by number of devices."""
    width, height, left, top, bottom = 640, 320, 70, 30, 50
    most_devices = max(result["devices"] for result in results)
    plots = [("rows_per_second", "rows a second, the whole fleet", "#1f6f8b"),
             ("cpu_us_per_row", "µs of the devices' CPU a row", "#c8553d")]
    parts = [f'<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 {width * 2} {height}" font-family="sans-serif"'
             ' font-size="13">', '<rect width="100%" height="100%" fill="white"/>']
    for number, (key, title, colour) in enumerate(plots):
        shift = number * width
        most = max(result[key] for result in results) * 1.15

        def at(result, shift=shift, most=most, key=key):
            x = shift + left + (width - left - 30) * result["devices"] / most_devices
            return x, height - bottom - (height - top - bottom) * result[key] / most

        parts.append(f'<text x="{shift + left}" y="18" font-weight="bold">{title}</text>')
        parts.append(f'<path d="M{shift + left} {top} V{height - bottom} H{shift + width - 20}" stroke="#888" fill="none"/>')
        points = " ".join("{:.1f},{:.1f}".format(*at(result)) for result in results)
        parts.append(f'<polyline points="{points}" fill="none" stroke="{colour}" stroke-width="2"/>')
        for result in results:
            x, y = at(result)
            parts.append(f'<circle cx="{x:.1f}" cy="{y:.1f}" r="3.5" fill="{colour}"/>')
            parts.append(f'<text x="{x:.1f}" y="{y - 9:.1f}" text-anchor="middle">{result[key]:g}</text>')
            if result["devices"] >= most_devices / 10 or result is results[0]:
                parts.append(f'<text x="{x:.1f}" y="{height - bottom + 18}" text-anchor="middle">{result["devices"]}</text>')
        parts.append(f'<text x="{shift + width / 2}" y="{height - 10}" text-anchor="middle">devices</text>')
    parts.append("</svg>")
    return "\n".join(parts) + "\n"


def main():
    parser = argparse.ArgumentParser(description=__doc__)
    parser.add_argument("build", type=pathlib.Path)
    parser.add_argument("devices", type=int, nargs="*", default=[10, 20, 50, 100, 200, 500])
    parser.add_argument("--rows", type=int, default=200, help="of each device (200)")
    parser.add_argument("--svg", type=pathlib.Path)
    options = parser.parse_args()
    results = []
    for devices in options.devices:
        results.append(measured(options.build, devices, options.rows))
        if len(results) == 1:
            print(" ".join(f"{key:>21}" for key in results[0]))
        print(" ".join(f"{value:>21}" for value in results[-1].values()), flush=True)
    if options.svg:
        options.svg.write_text(drawn(results))


if __name__ == "__main__":
    main()
