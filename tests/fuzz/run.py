#!/usr/bin/python3
"""Fuzzes one target for a minute, half an hour by night: run.py TARGET DICTIONARY CORPUS…"""

import os
import pathlib
import re
import subprocess
import sys
import tempfile

SECONDS = 1800 if os.environ.get("QUARVEL_NIGHTLY") else 60


def main():
    target, dictionary, *corpora = sys.argv[1:]
    with tempfile.TemporaryDirectory(prefix="quarvel-corpus-") as grown:
        fuzzed = subprocess.run(
            [target, f"-max_total_time={SECONDS}", f"-dict={dictionary}", "-max_len=8192",
             "-timeout=60", "-rss_limit_mb=1024", "-detect_leaks=0", "-print_final_stats=1",
             # Closes standard error for the service's log; libFuzzer and the sanitizers have a copy.
             "-close_fd_mask=2",
             f"-artifact_prefix={pathlib.Path(target).parent}/", grown, *corpora],
            stderr=subprocess.PIPE, text=True, errors="replace", check=False, timeout=SECONDS + 600)
    if fuzzed.returncode != 0:
        sys.stderr.write(fuzzed.stderr[-20000:])
        return 1
    executions = re.search(r"stat::number_of_executed_units: *(\d+)", fuzzed.stderr).group(1)
    memory = re.search(r"stat::peak_rss_mb: *(\d+)", fuzzed.stderr).group(1)
    coverage = re.findall(r"cov: (\d+)", fuzzed.stderr)[-1]
    print(f"harness: {pathlib.Path(target).name}: {executions} executions in {SECONDS} s, "
          f"{coverage} edges, {memory} MB at most")
    return 0


if __name__ == "__main__":
    sys.exit(main())
