"""Compares a polite client beside each hostile client with one alone, and with one of another service that
shares only the cores with the attack. Prints the figures; fails where the hostile client costs too much.

Usage: QUARVEL_PREFIX=PREFIX bench/hostile_bench.py [--quick]
"""

import pathlib
import statistics
import sys
import time

sys.path.insert(0, str(pathlib.Path(__file__).parents[1] / "tests/integration"))
import hostile
from harness import Service

SHORT_LIMITS = "[limits]\nframe_seconds = 1\nstall_seconds = 1\n"
LEAST_THROUGHPUT = 0.8  # of the throughput alone
MOST_LATENCY = 2  # times the latency of the other service's client
TIME_SLICE = 0.005  # seconds; within them the kernel's scheduler decides, not the service


def measure(polite, seconds):
    """Returns messages a second, and the 99th percentile of the seconds until the answer."""
    begun = time.perf_counter()
    times = polite.times(seconds)
    return len(times) / (time.perf_counter() - begun), statistics.quantiles(times, n=100)[98]


def compare(act, rounds, seconds):
    """Returns whether the polite client was served well enough: medians of rounds that take turns."""
    services = Service(SHORT_LIMITS).start(), Service().start()
    polite, elsewhere = map(hostile.PoliteClient, services)
    attacker = None
    try:
        compared = []
        for _ in range(rounds):
            alone = measure(polite, seconds)
            attacker = hostile.Hostile(services[0], act)
            beside, other = measure(polite, seconds), measure(elsewhere, seconds)
            attacker.end()
            compared.append((beside[0] / alone[0], beside[1] / alone[1], beside[1] / other[1], beside[1]))
    finally:
        if attacker:
            attacker.end()
        for service in services:
            service.finish()
            service.tidy()
    throughput, latency, share, p99 = map(statistics.median, zip(*compared))
    print(f"harness: hostile: {act.__name__}: throughput {throughput:.2f}, p99 {p99 * 1000:.1f} ms, "
          f"{latency:.1f} times that alone and {share:.1f} times another service's", flush=True)
    return throughput >= LEAST_THROUGHPUT and (share <= MOST_LATENCY or p99 <= TIME_SLICE)


def main():
    rounds, seconds = (3, 0.5) if "--quick" in sys.argv else (9, 2)
    failed = [act.__name__ for act in hostile.ATTACKS
              if not any(compare(act, rounds, seconds) for _ in range(3))]
    if failed:
        sys.exit(f"Too much for other clients: {', '.join(failed)}")


if __name__ == "__main__":
    main()
