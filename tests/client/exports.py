"""The shared library exports the declarations of the installed headers, and nothing else.

Usage: exports.py LIBRARY HEADER…"""

import pathlib
import re
import subprocess
import sys


def exported(library):
    listing = subprocess.run(["nm", "-DC", "--defined-only", library],
                             capture_output=True, text=True, check=True).stdout
    for line in listing.splitlines():
        kind, name = line.split(maxsplit=2)[-2:] if line[0] == " " else line.split(maxsplit=2)[1:]
        if kind != "A":  # the version itself
            yield re.sub(r"@.*", "", name)


def main():
    library, *headers = sys.argv[1:]
    texts = {path: pathlib.Path(path).read_text() for path in headers}
    words = set(re.findall(r"\w+", "".join(texts.values())))
    symbols = set(exported(library))
    wrong = []
    for symbol in sorted(symbols):
        name = re.split(r"[(\[]", symbol.replace("operator()", "operator"))[0]
        # A template's arguments and a result are in front of the name: nothing that is exported has
        # either.
        if any(part not in words for part in re.findall(r"\w+", name)) or " " in name:
            wrong.append(f"exported but declared in no header: {symbol}")
    for path, text in texts.items():
        if path.endswith("quarvel.h"):
            text = re.sub(r"/\*.*?\*/", "", text, flags=re.DOTALL)
            for function in re.findall(r"\b(quarvel_\w+)\(", text):
                if function not in symbols:
                    wrong.append(f"declared but not exported: {function}")
    print("\n".join(wrong))
    return 1 if wrong or len(symbols) < 100 else 0


if __name__ == "__main__":
    sys.exit(main())
