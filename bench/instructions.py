"""Counts the instructions that one message costs the service from its socket to its store, with
callgrind, and fails when they exceed the budget by a tenth.

Usage: bench/instructions.py QUARVELD SERVICE-LOAD QUARVELCTL BUDGET

Counts repeat where times do not. Both runs start and end the service, so these costs cancel out. A change
that makes a message dearer on purpose raises BUDGET; a change that makes it cheaper lowers BUDGET.
"""

import contextlib
import os
import pathlib
import re
import sqlite3
import subprocess
import sys
import tempfile

os.environ.setdefault("QUARVEL_TEST_PATIENCE", "300")  # callgrind makes the service fifty times slower
sys.path.insert(0, str(pathlib.Path(__file__).parents[1] / "tests/integration"))
from harness import PATIENCE, eventually

FEW, MANY = 1000, 9000  # messages
# On a busy machine the store commits small transactions, which makes a message dearer.
ATTEMPTS = 12


def stored(database):
    with contextlib.suppress(sqlite3.Error), contextlib.closing(
            sqlite3.connect(f"file:{database}?mode=ro", uri=True)) as connection:
        return connection.execute("SELECT count(*) FROM message").fetchone()[0]
    return 0


def instructions(quarveld, load, ctl, messages):
    """Instructions of a service that takes so many messages of one session. The session is not stopped,
    since its summary would count too."""
    with tempfile.TemporaryDirectory(prefix="quarvel-") as name, contextlib.ExitStack() as processes:
        directory = pathlib.Path(name)
        (directory / "quarvel.toml").write_text('[log]\nlevel = "error"\n[analytics]\nwanted = []\n')
        environment = dict(os.environ, RUNTIME_DIRECTORY=name, STATE_DIRECTORY=name,
                           CONFIGURATION_DIRECTORY=name)
        for inherited in ("QUARVEL_SOCKET", "LISTEN_FDS", "LISTEN_PID", "NOTIFY_SOCKET"):
            environment.pop(inherited, None)
        service = subprocess.Popen(
            ["valgrind", "--tool=callgrind", "--callgrind-out-file=/dev/null", quarveld],
            env=environment, stderr=subprocess.PIPE, text=True)
        processes.callback(service.kill)
        eventually((directory / "reporting.sock").exists, "the service's socket", 0.05)
        sender = subprocess.Popen([load, directory / "reporting.sock", str(messages)],
                                  stdin=subprocess.PIPE, stdout=subprocess.DEVNULL)
        processes.callback(sender.kill)
        eventually(lambda: stored(directory / "telemetry.db") >= messages, "the last row", 0.05)
        subprocess.run([ctl, "kill"], env=environment, check=False, capture_output=True, timeout=PATIENCE)
        report = service.communicate(timeout=PATIENCE)[1]
        sender.communicate(timeout=PATIENCE)
        return int(re.search(r"Collected : (\d+)", report).group(1))


def main(quarveld, load, ctl, budget):
    budget = int(budget)
    for _ in range(ATTEMPTS):
        few, many = (instructions(quarveld, load, ctl, messages) for messages in (FEW, MANY))
        each = (many - few) / (MANY - FEW)
        print(f"harness: {each:.0f} instructions a message, {100 * each / budget:.1f} % of the budget of {budget}",
              flush=True)
        if each <= 1.1 * budget:
            return
    sys.exit("A message has become dearer; callgrind_annotate shows where.")


if __name__ == "__main__":
    if len(sys.argv) != 5:
        sys.exit(__doc__)
    main(*sys.argv[1:])
