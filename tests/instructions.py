"""Counts the instructions that one message costs the service on its way from socket to store, with
callgrind, and fails when they are a tenth more than the budget says.

Usage: instructions.py QUARVELD SERVICE-LOAD QUARVELCTL BUDGET

Counts repeat where times do not. What it costs to start and to end is in both runs and cancels out. A
change that makes a message dearer on purpose changes BUDGET with it; one that makes it cheaper should.
"""

import contextlib
import os
import pathlib
import re
import sqlite3
import subprocess
import sys
import tempfile
import time

FEW, MANY = 1000, 9000
# Where others keep the cores busy, the store's transactions are small, which makes a message dearer.
ATTEMPTS = 12
PATIENCE = 300


def until(condition, what):
    deadline = time.monotonic() + PATIENCE
    while not condition():
        if time.monotonic() > deadline:
            sys.exit(f"never came about: {what}")
        time.sleep(0.05)


def stored(database):
    with contextlib.suppress(sqlite3.Error), contextlib.closing(
            sqlite3.connect(f"file:{database}?mode=ro", uri=True)) as connection:
        return connection.execute("SELECT count(*) FROM message").fetchone()[0]
    return 0


def instructions(quarveld, load, ctl, messages):
    """Of a whole life of the service with so many messages of one session, which is not stopped: its
    summary would count too."""
    with tempfile.TemporaryDirectory(prefix="quarvel-") as name:
        directory = pathlib.Path(name)
        (directory / "quarvel.toml").write_text('[log]\nlevel = "error"\n[analytics]\nwanted = []\n')
        environment = dict(os.environ, RUNTIME_DIRECTORY=name, STATE_DIRECTORY=name,
                           CONFIGURATION_DIRECTORY=name)
        for inherited in ("QUARVEL_SOCKET", "LISTEN_FDS", "LISTEN_PID", "NOTIFY_SOCKET"):
            environment.pop(inherited, None)
        service = subprocess.Popen(
            ["valgrind", "--tool=callgrind", "--callgrind-out-file=/dev/null", quarveld],
            env=environment, stderr=subprocess.PIPE, text=True)
        until((directory / "reporting.sock").exists, "the service's socket")
        sender = subprocess.Popen([load, directory / "reporting.sock", str(messages)],
                                  stdin=subprocess.PIPE, stdout=subprocess.PIPE)
        sender.stdout.readline()
        until(lambda: stored(directory / "telemetry.db") >= messages, "the last row")
        subprocess.run([ctl, "kill"], env=environment, check=False, capture_output=True)
        said = service.communicate(timeout=PATIENCE)[1]
        sender.communicate()
        return int(re.search(r"Collected : (\d+)", said).group(1))


def main(quarveld, load, ctl, budget):
    budget = int(budget)
    for _ in range(ATTEMPTS):
        few, many = (instructions(quarveld, load, ctl, messages) for messages in (FEW, MANY))
        each = (many - few) / (MANY - FEW)
        print(f"harness: {each:.0f} instructions a message, {100 * each / budget:.1f} % of the budget of {budget}",
              flush=True)
        if each <= 1.1 * budget:
            return
    sys.exit("A message has become dearer; callgrind_annotate says where.")


if __name__ == "__main__":
    if len(sys.argv) != 5:
        sys.exit(__doc__)
    main(*sys.argv[1:])
