"""Holds the rules about who may include what. Run with the repository's root; "--self-check" proves
that the rules still bite."""

import pathlib
import re
import sys
import tempfile

FMT = r"fmt/\w+\.h"
STANDARD = r"[a-z_0-9]+"
SYSTEM = r"(sys/\w+|arpa/\w+|netinet/\w+|linux/\w+|[a-z0-9_]+)\.h"  # the C library's and the kernel's
ANYTHING = r".*"

# The first folder that a file is in decides. Patterns are for the whole text between the quotes or
# the angle brackets.
RULES = [
    ("base/", [r"base/\w+\.h"], [STANDARD, FMT, r"rapidjson/.*"]),
    ("platform/linux/", [r"(base|platform)/.*"], [ANYTHING]),
    ("platform/", [r"base/\w+\.h", r"platform/\w+\.h"], [STANDARD, FMT]),
    ("Statistics/", [r"base/\w+\.h", r"platform/\w+\.h", r"Statistics/.*"], [STANDARD, FMT]),
    ("client/", [r"base/\w+\.h", r"client/.*"], [STANDARD, SYSTEM, FMT, r"quarvel/.*"]),
    ("tools/", [r"base/\w+\.h", r"tools/.*", r"platform/linux/store/StoreErasure\.h"],
     [STANDARD, SYSTEM, FMT, r"quarvel/.*", r"CLI/CLI\.hpp", r"sqlite3\.h", r"toml\+\+/toml\.h"]),
    ("examples/", [], [STANDARD, SYSTEM, r"quarvel/.*"]),
    ("deploy/", [], [STANDARD, SYSTEM, r"nats/nats\.h"]),
    ("tests/", [ANYTHING], [ANYTHING]),
    ("bench/", [ANYTHING], [ANYTHING]),
]
# What belongs to one folder alone, whatever the others may include.
KEPT = [(r"rapidjson/.*", "base/"), (r"CLI/.*", "tools/"), (r"asio(/.*|\.hpp)", "platform/linux/")]
FREE = ("tests/", "bench/")

INCLUDE = re.compile(r'^\s*#\s*include\s*(?:"([^"]+)"|<([^>]+)>)')


def matches(patterns, name):
    return any(re.fullmatch(pattern, name) for pattern in patterns)


def fault(path, quoted, angled):
    """Why the file at `path` may not include this, or None."""
    room, ours, theirs = next((rule for rule in RULES if path.startswith(rule[0])),
                              (None, None, None))
    if room is None:
        return "is in no folder that the rules know"
    name = quoted or angled
    if room in FREE:
        return None
    for pattern, keeper in KEPT:
        if re.fullmatch(pattern, name) and room != keeper:
            return f"includes {name}, which is kept to {keeper}"
    if not matches(ours if quoted else theirs, name):
        return f"includes {name}, which is not for {room}"
    return None


def faults(root):
    for pattern in ("*.h", "*.hpp", "*.cc", "*.c"):
        for file in sorted(root.rglob(pattern)):
            path = file.relative_to(root).as_posix()
            if path.startswith(("build/", "demo/", ".")):
                continue
            for number, line in enumerate(file.read_text().splitlines(), 1):
                found = INCLUDE.match(line)
                reason = found and fault(path, found[1], found[2])
                if reason:
                    yield f"{path}:{number}: {reason}"


FORBIDDEN = [
    ("base/Value.h", '"platform/Clock.h"'),
    ("base/Value.h", "<unistd.h>"),
    ("platform/Clock.h", "<asio.hpp>"),
    ("platform/Clock.h", "<sys/epoll.h>"),
    ("platform/WorkQueue.cc", '"platform/linux/work/Work.h"'),
    ("platform/linux/store/Store.cc", "<rapidjson/writer.h>"),
    ("platform/linux/store/Store.cc", '"Statistics/ZQReportingUtility.h"'),
    ("Statistics/ZQReportingUtility.cc", '"platform/linux/system/Directories.h"'),
    ("Statistics/Service/main.cc", "<sqlite3.h>"),
    ("client/Client.cc", '"platform/Clock.h"'),
    ("client/Client.cc", '"Statistics/ZQReportingUtility.h"'),
    ("client/Client.cc", "<CLI/CLI.hpp>"),
    ("client/Client.cc", "<toml++/toml.h>"),
    ("tools/Store.cc", '"platform/linux/store/Store.h"'),
    ("examples/client.c", '"base/Value.h"'),
    ("tools/quarvelctl.cc", "<asio.hpp>"),
    ("elsewhere/File.cc", "<vector>"),
]


def self_check():
    """Plants each case in a tree of its own and looks whether it is found."""
    for path, include in FORBIDDEN:
        with tempfile.TemporaryDirectory() as root:
            file = pathlib.Path(root, path)
            file.parent.mkdir(parents=True)
            file.write_text(f"// A planted case.\n#include {include}\n")
            lines = [int(found.split(":")[1]) for found in faults(pathlib.Path(root))]
            if lines != [2]:
                yield f"{path} with {include}: faults in lines {lines}, expected one in line 2"


def main():
    found = list(self_check() if sys.argv[1] == "--self-check" else faults(pathlib.Path(sys.argv[1])))
    print("\n".join(found))
    return 1 if found else 0


if __name__ == "__main__":
    sys.exit(main())
