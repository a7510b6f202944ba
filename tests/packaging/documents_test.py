"""What people read about the service says all that there is, and nothing that is not."""

import os
import pathlib
import re
import subprocess
import tempfile
import unittest

from harness import Client, Service

SOURCE = pathlib.Path(os.environ["QUARVEL_SOURCE"])
PREFIX = pathlib.Path(os.environ["QUARVEL_PREFIX"])
MANUALS = SOURCE / "docs/man"
QUARVELCTL = PREFIX / "bin/quarvelctl"


def run(*command, **options):
    return subprocess.run(list(map(str, command)), capture_output=True, text=True, timeout=60, **options)


def plain(page):
    """A manual page as it is read."""
    return re.sub(r".\x08", "", run("mandoc", "-Tascii", "-O", "width=500", MANUALS / page).stdout)


class Manuals(unittest.TestCase):
    def test_they_are_well_formed(self):
        for page in sorted(MANUALS.iterdir()):
            linted = run("mandoc", "-Tlint", "-W", "warning", page)
            self.assertEqual((linted.returncode, linted.stdout), (0, ""), page.name)


class Configuration(unittest.TestCase):
    """quarvel.toml: what is read, what is described, what is installed."""

    @classmethod
    def setUpClass(cls):
        # What the service reads: Section NAME(findings, table, "path"), then NAME.read("key", …), or
        # a function that several sections are given to.
        source = "".join(path.read_text() for path in (SOURCE / "system").glob("Configuration*.cc"))
        shared, cls.keys = {}, set()
        for function in re.split(r"(?m)^(?=\S.*\) \{$)", source):
            name = re.match(r"void (\w+)\(Section& (\w+)", function)
            own = {name[2]: None} if name else {}
            own |= dict(re.findall(r'Section (\w+)\([^)]*"([\w.]*)"\);', function))
            for reader, key in re.findall(r'\b(\w+)\.read(?:<[\w:]+>)?\(\s*"(\w+)"', function):
                if name:
                    shared.setdefault(name[1], []).append(key)
                else:
                    cls.keys.add((own[reader], key))
            for called, reader in re.findall(r"\b(\w+)\((\w+), ", function):
                cls.keys |= {(own[reader], key) for key in shared.get(called, ()) if own.get(reader)}
        assert ("limits", "depth") in cls.keys and ("agent.nats", "tls_ca") in cls.keys, cls.keys

    def test_every_key_is_described(self):
        text = plain("quarvel.toml.5")
        for section, key in self.keys:
            self.assertRegex(text, rf"\b{key}\b", f"{section}.{key} in quarvel.toml(5)")

    def test_the_file_that_is_installed_has_every_key(self):
        installed = (PREFIX / "etc/quarvel/quarvel.toml").read_text()
        section, there = "", set()
        for line in installed.splitlines():
            if heading := re.fullmatch(r"#?\[+([\w.]+)\]+", line):
                section = heading[1]
            elif entry := re.match(r"#(\w+) = ", line):
                there.add((section, entry[1]))
        self.assertEqual(there - {("device", "InternalBuild"), ("device", "DeviceClassNumber")}, self.keys)

    def test_what_is_commented_out_may_be_used_as_it_stands(self):
        installed = (PREFIX / "etc/quarvel/quarvel.toml").read_text()
        with tempfile.TemporaryDirectory() as directory:
            used = re.sub(r"(?m)^#(\w+ = |\[\[)", r"\1", installed)
            (pathlib.Path(directory) / "quarvel.toml").write_text(used + "no_such_key = 1\n")
            # It cannot have this store, so it ends at once.
            ended = run(PREFIX / "sbin/quarveld", env=dict(
                os.environ, CONFIGURATION_DIRECTORY=directory, STATE_DIRECTORY="/proc/no-such-directory",
                RUNTIME_DIRECTORY=directory))
            complaints = [line for line in ended.stderr.splitlines() if "quarvel.toml" in line]
            self.assertEqual(len(complaints), 1, ended.stderr)
            self.assertIn("no_such_key is no key of ours", complaints[0])


class CommandLine(unittest.TestCase):
    """quarvelctl: what it takes, what its manual describes, what the shells complete."""

    @classmethod
    def setUpClass(cls):
        cls.commands = {}  # a command's words to its options
        waiting = [()]
        while waiting:
            words = waiting.pop()
            help_text = run(QUARVELCTL, *words, "--help").stdout
            cls.commands[words] = set(re.findall(r"^ +(?:-\w,)?(--[a-z-]+)", help_text, re.M))
            _, _, below = help_text.partition("Subcommands:\n")
            waiting += [(*words, name) for name in re.findall(r"^  ([a-z]\w*) ", below, re.M)]
        assert "--follow" in cls.commands[("messages",)] and ("defaults", "write") in cls.commands

    def test_the_manual_describes_every_command_and_option(self):
        text = plain("quarvelctl.1")
        for words, options in self.commands.items():
            if not words:
                continue
            synopsis = re.search(rf"^     {' '.join(words)}\b.*$", text, re.M)
            if words == ("defaults",):
                continue  # each of its parts is described
            self.assertIsNotNone(synopsis, words)
            for option in options - self.commands[()]:
                self.assertIn(option, synopsis[0], words)
        for option in self.commands[()]:
            self.assertIn(option, text)

    def complete(self, *words):
        """What bash offers for the last of these words."""
        script = f"""
            source {PREFIX}/share/bash-completion/completions/quarvelctl
            compopt() {{ :; }}
            COMP_WORDS=("$@") COMP_CWORD=$(($# - 1))
            _quarvelctl
            printf '%s\\n' "${{COMPREPLY[@]}}"
            """
        path = f"{PREFIX}/bin:{os.environ['PATH']}"
        done = run("bash", "-c", script, "bash", "quarvelctl", *words, env=dict(os.environ, PATH=path))
        self.assertEqual(done.stderr, "")
        return set(done.stdout.split())

    def test_bash_completes_every_command_and_option(self):
        for words, options in self.commands.items():
            below = {other[-1] for other in self.commands if other[:-1] == words and other != words}
            offered = self.complete(*words, "")
            self.assertLessEqual(below, offered, words)
            if words:  # what the command above it takes, it takes too
                options = options | self.commands[words[:-1]] | self.commands[()]
            self.assertEqual(self.complete(*words, "--") | {"--version"}, options | {"--version"}, words)
        self.assertEqual(self.complete("mess"), {"messages"})
        self.assertEqual(self.complete("--store", "/tmp", "messages", "--fo"), {"--follow"})
        self.assertEqual(self.complete("defaults", "--domain", "x", "wr"), {"write"})

    def test_bash_completes_reporter_ids_from_the_store(self):
        service = Service()
        self.addCleanup(service.tidy)
        service.start()
        self.addCleanup(service.finish)
        client = Client(service)
        self.addCleanup(client.close)
        for reporter in (4102, 4103, -7):
            client.start_session(reporter, configuration={"session": 99})
        service.wait_for_rows(3, "agent_session")
        os.environ["STATE_DIRECTORY"] = str(service.directory / "state")
        self.addCleanup(os.environ.pop, "STATE_DIRECTORY")
        self.assertEqual(self.complete("summary", ""), {"4102", "4103", "-7"})
        self.assertEqual(self.complete("messages", "--session", "41"), {"4102", "4103"})

    def test_zsh_knows_every_command_and_option(self):
        completion = PREFIX / "share/zsh/vendor-completions/_quarvelctl"
        self.assertEqual(run("zsh", "-n", completion).stderr, "")
        text = completion.read_text()
        for words, options in self.commands.items():
            if words:
                self.assertRegex(text, rf"'{words[-1]}:|\b{words[-1]}\)", words)
            for option in options:
                self.assertIn(option, text, words)


class Diagnostics(unittest.TestCase):
    SERVICE = ("Statistics", "queues", "system", "transport", "store", "export", "device", "linux")

    @classmethod
    def setUpClass(cls):
        cls.page = re.sub(r"\s+", " ", (SOURCE / "docs/diagnostics.md").read_text())
        cls.sources = {path: path.read_text() for folder in cls.SERVICE
                       for path in sorted((SOURCE / folder).rglob("*.cc"))}

    def test_every_error_line_is_explained(self):
        missing, lines = [], 0
        for path, source in self.sources.items():
            for line in re.finditer(r'ZQ_LOG\([^,]+,\s*error,\s*((?:"(?:[^"\\]|\\.)*"\s*)+)', source):
                text = "".join(re.findall(r'"((?:[^"\\]|\\.)*)"', line[1])).replace('\\"', '"')
                text = re.sub(r"\{[^}]*\}", "…", text)
                if not re.search(r"\w", text):  # known by its function
                    text = re.findall(r'ZQ_FUNCTION\(\s*"([^"]*)"', source[:line.start()])[-1] + ": "
                if f"`{text}" not in self.page:
                    missing.append(f"{path.name}: {text}")
                lines += 1
        self.assertEqual(missing, [], "not in docs/diagnostics.md")
        self.assertGreater(lines, 30)

    def test_every_trace_code_is_listed(self):
        codes = {code for source in self.sources.values() for code in re.findall(r"kTrace\w+ = (0x\w+);", source)}
        self.assertEqual(codes, set(re.findall(r"\| `(0x\w+)` \|", self.page)))

    def test_the_probe_is_in_the_binary(self):
        notes = run("readelf", "-n", PREFIX / "sbin/quarveld").stdout
        self.assertRegex(notes, r"Provider: quarvel\s+Name: event\s+.*\s+Arguments: 4@\S+( 8@\S+){4}")


if __name__ == "__main__":
    unittest.main(verbosity=2)
