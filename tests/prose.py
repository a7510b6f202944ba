"""Checks comments and pages for plain English: few free relatives and indefinite pronouns, no long sentence.

Usage: prose.py ROOT [PATH ...]; with paths, lists every counted word below them."""

import contextlib
import pathlib
import re
import sys

ALLOWED_PER_1000_WORDS = 1.5
LONGEST_SENTENCE = 35

COUNTED = re.compile(
    r"\b(?:what|who|whoever|whatever|whom|nobody|somebody|anybody|those (?:who|that|of))\b", re.IGNORECASE)
CODE = {".h", ".hpp", ".cc", ".c", ".js"}
HASH = {".py", ".sh", ".cmake", ".toml", ".conf", ".service", ".socket", ".in"}
PAGES = {".md"}
# Folders of generated files, and of tools that are not the project's.
SKIPPED = ("build/", "demo/", ".git/", "tests/fuzz/seeds/", "tests/fuzz/regressions/", "node_modules/")


def blocks_of_code(text):
    """Comments of C++ and JavaScript: each run of // lines is one block, and so is each /* */."""
    text = re.sub(r'R"(\w*)\(.*?\)\1"', lambda found: "\n" * found[0].count("\n"), text, flags=re.S)
    block, start = [], 0
    for number, line in enumerate(text.splitlines(), 1):
        found = re.match(r'(?:[^"/]|"(?:[^"\\]|\\.)*"|\'"\'|/(?!/))*//[/!]?<?(.*)$', line)
        own = found and not line[:found.start(1)].strip(" /!<")
        if block and not own:
            yield start, "\n".join(block)
            block = []
        if found:
            block, start = block or [], start if block else number
            block.append(found[1].strip())
            if not own:
                yield start, "\n".join(block)
                block = []
    if block:
        yield start, "\n".join(block)
    # Neither a string nor a // comment opens a comment of the other kind.
    for found in re.finditer(r'"(?:[^"\\\n]|\\.)*"|//[^\n]*|/\*(.*?)\*/', text, re.S):
        if found[1]:
            yield text.count("\n", 0, found.start()) + 1, re.sub(r"(?m)^\s*\*", "", found[1])


def blocks_of_hash(text):
    """Runs of # lines, comments behind code, and Python's docstrings; no other string."""
    block, start = [], 0
    for number, line in enumerate([*text.splitlines(), ""], 1):
        own = re.match(r"\s*#(?!!)\s?(.*)$", line)
        behind = re.match(r"""(?:[^"'#]|"(?:[^"\\]|\\.)*"|'[^']*')*\S.*\s#\s+(.*)$""", line)
        if own:
            start = start if block else number
            block.append(own[1])
            continue
        if block:
            yield start, "\n".join(block)
            block = []
        if behind:
            yield number, behind[1]
    for found in re.finditer(r'([^\n]*?)"""(.*?)"""', text, re.S):
        if not found[1].strip():
            yield text.count("\n", 0, found.start(2)) + 1, found[2]


def blocks_of_page(text):
    """Paragraphs, headings, list items and table cells."""
    text = re.sub(r"(?ms)^\s*```.*?^\s*```", lambda found: "\n" * found[0].count("\n"), text)
    block, start = [], 0
    for number, line in enumerate([*text.splitlines(), ""], 1):
        stripped = line.strip()
        if block and (not stripped or re.match(r"([#|>*+-]|\d+\.)\s?", stripped)):
            yield start, " ".join(block)
            block = []
        if stripped.startswith("|"):
            for cell in stripped.strip("|").split("|"):
                yield number, cell
        elif stripped:
            start = start if block else number
            block.append(re.sub(r"^([#>*+-]+|\d+\.)\s", "", stripped))


def blocks_of_manual(text):
    """Paragraphs of a manual page; a request for a new paragraph ends one, verbatim text is skipped."""
    block, start, verbatim = [], 0, False
    for number, line in enumerate([*text.splitlines(), ".Pp"], 1):
        request = re.match(r"\.(\w+)\s*(.*)", line)
        if request and request[1] in ("Bd", "Ed"):
            verbatim = request[1] == "Bd"
        if request and request[1] in ("Pp", "Sh", "Ss", "It", "Bl", "El", "Bd", "Ed", "Dd", "Dt", "Os"):
            if block:
                yield start, " ".join(block)
            block = []
        elif not verbatim:
            start = start if block else number
            # The argument of a request is a name or a quotation.
            block.append(f"`{request[2]}`" if request else re.sub(r"\\f.|\\&", "", line))


def sentences(block):
    text = re.sub(r"`[^`]*`|<[^>\s]+>|\[([^]]*)\]\([^)]*\)", lambda found: found[1] or "code", block)
    text = re.sub(r'"[^"]*"', "quote", text.replace("\\-", "-"))
    # A list inside a comment, an empty line and a colon before a list end a sentence too.
    text = re.sub(r"\n\s*\n|\n\s*[-*|]\s|;\s", ". ", text)
    yield from re.split(r"(?<=[.!?:])[\s)*]+(?=[A-Z\"`(*\[0-9a-z-])", re.sub(r"\s+", " ", text))


def blocks(path, text):
    if path.suffix in CODE:
        return blocks_of_code(text)
    if path.suffix in PAGES:
        return blocks_of_page(text)
    if "man" in path.parts and re.fullmatch(r"\.\d", path.suffix):
        return blocks_of_manual(text)
    if path.suffix in HASH or path.name == "CMakeLists.txt" or text.startswith("#!"):
        return blocks_of_hash(text)
    return ()


def files(root, wanted):
    for path in sorted(root.rglob("*")):
        name = path.relative_to(root)
        skipped = any(f"{name}/".startswith(folder) or f"/{folder}" in f"/{name}" for folder in SKIPPED)
        if not skipped and f"{name}".startswith(wanted) and path.is_file() and not path.is_symlink():
            with contextlib.suppress(UnicodeDecodeError):
                yield name, path.read_text()


def main():
    root, wanted = pathlib.Path(sys.argv[1]), tuple(sys.argv[2:])
    words = counted = 0
    long, found_in = [], []
    for name, text in files(root, wanted or ""):
        for line, block in blocks(name, text):
            for sentence in sentences(block):
                length = len(re.findall(r"\w[\w'’-]*", sentence))
                matches = COUNTED.findall(sentence)
                words += length
                counted += len(matches)
                if matches:
                    found_in.append(f"{name}:{line}: {', '.join(matches)}: {sentence.strip()}")
                if length > LONGEST_SENTENCE:
                    long.append(f"{name}:{line}: {length} words: {sentence.strip()}")
    rate = 1000 * counted / max(words, 1)
    if wanted or rate > ALLOWED_PER_1000_WORDS:
        print("\n".join(found_in))
    print("".join(f"{line}\n" for line in long), end="")
    print(f"{counted} counted words in {words}: {rate:.2f} per 1,000 (at most {ALLOWED_PER_1000_WORDS}); "
          f"{len(long)} sentences over {LONGEST_SENTENCE} words (none)")
    return 1 if long or rate > ALLOWED_PER_1000_WORDS else 0


if __name__ == "__main__":
    sys.exit(main())
