"""Checks which folder includes which headers. Usage: include_rules.py ROOT"""

import pathlib
import re
import sys

FMT = r"fmt/\w+\.h"
STANDARD = r"[a-z_0-9]+"
# The headers of the C library and of the kernel.
SYSTEM = r"(sys/\w+|arpa/\w+|netinet/\w+|linux/\w+|[a-z0-9_]+)\.h"
SYSTEMD = r"systemd/[\w-]+\.h"
SDT = r"sys/sdt\.h"
TOML = r"toml\+\+/toml\.h"
SQLITE = r"sqlite3\.h"
ANYTHING = r".*"


def folder(*names):
    """Headers that lie directly in these folders."""
    return [rf"{name}/\w+\.h" for name in names]


LINUX = [STANDARD, FMT, SYSTEM]
BELOW = ["base", "platform"]

# The longest folder that a path begins with decides. Patterns are for the whole text between the
# quotes (project) or the angle brackets (libraries).
RULES = {
    "base/": (folder("base"), [STANDARD, FMT, r"rapidjson/.*"]),
    "base/Files.": (folder("base"), LINUX),
    "base/StandardPaths.": (folder("base"), LINUX),
    "platform/": (folder(*BELOW), [STANDARD, FMT]),
    "Statistics/": ([*folder(*BELOW), r"Statistics/.*"], [STANDARD, FMT]),
    "quotas/": (folder(*BELOW, "quotas"), [STANDARD, FMT]),
    "queues/": (folder(*BELOW, "quotas", "queues"), LINUX),
    "system/": (folder(*BELOW, "quotas", "queues", "system"), [*LINUX, SYSTEMD, TOML]),
    "transport/": (folder(*BELOW, "quotas", "queues", "system", "transport"),
                   [*LINUX, SYSTEMD, r"asio(/.*|\.hpp)"]),
    "store/": (folder(*BELOW, "quotas", "queues", "system", "store", "store/database"), LINUX),
    "store/database/": (folder("base", "store/database"), [*LINUX, SQLITE]),
    "export/": (folder(*BELOW, "queues", "system", "store", "store/database", "export"),
                [*LINUX, SYSTEMD]),
    "export/nats/": (folder(*BELOW, "queues", "system", "store", "store/database", "export", "export/nats"),
                     [*LINUX, TOML, r"nats/nats\.h"]),
    "export/otlp/": ([*folder(*BELOW, "queues", "system", "store", "store/database", "export", "export/otlp")],
                     [*LINUX, TOML, r"curl/curl\.h", r"zlib\.h"]),
    "device/": (folder(*BELOW, "queues", "system", "device"), [*LINUX, SYSTEMD, TOML]),
    "linux/": ([ANYTHING], [*LINUX, SYSTEMD, SDT]),
    "client/": ([r"base/\w+\.h", r"client/.*"], [*LINUX, r"quarvel/.*"]),
    "tools/": ([*folder("base", "store/database", "tools")],
               [*LINUX, r"quarvel/.*", r"CLI/CLI\.hpp", TOML]),
    "examples/": ([], [STANDARD, SYSTEM, r"quarvel/.*"]),
    "fleet/": (folder("base", "fleet"), [*LINUX, r"nats/nats\.h"]),
    "tests/simulated/": (folder(*BELOW, "quotas", "tests/simulated"), [STANDARD, FMT, r"g(test|mock)/.*"]),
    "tests/": ([ANYTHING], [ANYTHING]),
    "bench/": ([ANYTHING], [ANYTHING]),
}

INCLUDE = re.compile(r'^\s*#\s*include\s*(?:"([^"]+)"|<([^>]+)>)')


def faults(root):
    for file in sorted(file for kind in ("h", "hpp", "cc", "c") for file in root.rglob(f"*.{kind}")):
        path = file.relative_to(root).as_posix()
        if path.startswith(("build/", "demo/", ".")):
            continue
        rule = max((known for known in RULES if path.startswith(known)), key=len, default=None)
        if rule is None:
            yield f"{path}: is in no folder that the rules know"
            continue
        for number, line in enumerate(file.read_text().splitlines(), 1):
            found = INCLUDE.match(line)
            name = found and (found[1] or found[2])
            if found and not any(re.fullmatch(pattern, name) for pattern in RULES[rule][0 if found[1] else 1]):
                yield f"{path}:{number}: includes {name}, which is not for {rule}"


if __name__ == "__main__":
    found = list(faults(pathlib.Path(sys.argv[1])))
    sys.exit("\n".join(found) if found else 0)
