"""The shared library exports the declarations of the installed headers, and nothing else.

Usage: exports.py LIBRARY HEADER…"""

import pathlib
import re
import subprocess
import sys

library, *headers = sys.argv[1:]
listing = subprocess.run(["nm", "-DC", "--defined-only", library], capture_output=True, text=True, check=True).stdout
symbols = [re.sub("@.*", "", line[19:]) for line in listing.splitlines() if line[17] != "A"]  # A: the version itself
text = "".join(pathlib.Path(header).read_text() for header in headers)
words = set(re.findall(r"\w+", text))
wrong = [] if len(symbols) >= 100 else ["too few symbols"]
for symbol in symbols:
    name, nested = symbol, 1
    while nested:  # templates of the headers and of the standard library, which only -O0 leaves as functions
        name, nested = re.subn("<[^<>]*>", "", name)
    name = re.split(r"[(\[]", name.replace("operator()", "operator"))[0]
    if not set(re.findall(r"\w+", name)) <= words and not name.split()[-1].startswith("std::"):
        wrong.append(f"exported but declared in no header: {symbol}")
for function in re.findall(r"\b(quarvel_\w+)\(", re.sub(r"/\*.*?\*/", "", text, flags=re.DOTALL)):
    if function not in symbols:
        wrong.append(f"declared but not exported: {function}")
sys.exit("\n".join(wrong) or 0)
