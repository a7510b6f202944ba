"""Every setting key, command, option and error line is documented, and the installed configuration is valid."""

import os
import pathlib
import re
import subprocess
import tempfile

from harness import PATIENCE, PREFIX, ServiceTest

SOURCE = pathlib.Path(os.environ["QUARVEL_SOURCE"])
PRODUCT = ("Statistics", "queues", "system", "transport", "store", "export", "device", "linux")
MANUALS = SOURCE / "docs/man"


def run(*command, **options):
    return subprocess.run(list(map(str, command)), capture_output=True, text=True, timeout=PATIENCE, **options)


def plain(page):
    """A manual page as text."""
    return re.sub(r".\x08", "", run("mandoc", "-Tascii", "-O", "width=500", MANUALS / page).stdout)


class Documents(ServiceTest):
    def test_manuals_are_well_formed(self):
        for page in sorted(MANUALS.iterdir()):
            linted = run("mandoc", "-Tlint", "-W", "warning", page)
            self.assertEqual((linted.returncode, linted.stdout), (0, ""), page.name)

    def sources(self):
        return [path.read_text() for folder in PRODUCT for path in sorted((SOURCE / folder).rglob("*.cc"))]

    def test_every_key_is_in_the_manual_and_in_the_installed_file_which_is_valid(self):
        installed = (PREFIX / "etc/quarvel/quarvel.toml").read_text()
        keys = set(re.findall(r"(?m)^#(\w+) = ", installed))
        read = {key for text in self.sources() for key in re.findall(r'\.read(?:<[\w:]+>)?\(\s*"(\w+)"', text)}
        self.assertEqual(keys - read, {"InternalBuild", "DeviceClassNumber"}, "read as device properties")
        self.assertEqual(read - keys, set(), "missing in the installed file")
        manual = plain("quarvel.toml.5")
        self.assertEqual([key for key in keys if not re.search(rf"\b{key}\b", manual)], [])

        with tempfile.TemporaryDirectory() as directory:
            used = re.sub(r"(?m)^#(\w+ = |\[\[)", r"\1", installed)
            (pathlib.Path(directory) / "quarvel.toml").write_text(used + "no_such_key = 1\n")
            # It cannot have this store, so it ends at once.
            ended = run(PREFIX / "sbin/quarveld", env=dict(
                os.environ, CONFIGURATION_DIRECTORY=directory, STATE_DIRECTORY="/proc/no-such-directory",
                RUNTIME_DIRECTORY=directory))
            [complaint] = [line for line in ended.stderr.splitlines() if "quarvel.toml" in line]
            self.assertIn("no_such_key", complaint)

    def test_every_command_and_option_is_in_the_manual_and_completed(self):
        manual = plain("quarvelctl.1")
        bash = PREFIX / "share/bash-completion/completions/quarvelctl"
        zsh = PREFIX / "share/zsh/vendor-completions/_quarvelctl"
        for shell, completion in (("bash", bash), ("zsh", zsh)):
            self.assertEqual(run(shell, "-n", completion).stderr, "")
        commands = [()]
        for words in commands:
            help_text = run(PREFIX / "bin/quarvelctl", *words, "--help").stdout
            _, _, below = help_text.partition("Subcommands:\n")
            commands += [(*words, name) for name in re.findall(r"^  ([a-z]\w*) ", below, re.M)]
            for word in {*words, *re.findall(r"^ +(?:-\w,)?(--[a-z-]+)", help_text, re.M)}:
                for text in (manual, bash.read_text(), zsh.read_text()):
                    self.assertRegex(text, rf"(?<![\w-]){word}\b", words)
        self.assertIn(("defaults", "write"), commands)

    def test_bash_completes_reporter_ids_from_the_store(self):
        service = self.service()
        client = self.client(service)
        for reporter in (4102, 4103, -7):
            client.start_session(reporter, configuration={"session": 99})
        service.wait_for_rows(3, "agent_session")
        script = f"""
            source {PREFIX}/share/bash-completion/completions/quarvelctl
            compopt() {{ :; }}
            COMP_WORDS=("$@") COMP_CWORD=$(($# - 1))
            _quarvelctl
            printf '%s\\n' "${{COMPREPLY[@]}}"
            """
        environment = service.environment | {"PATH": f"{PREFIX}/bin:{os.environ['PATH']}"}
        for words, offered in (
                (("summary", ""), {"4102", "4103", "-7"}), (("messages", "--session", "41"), {"4102", "4103"}),
                (("mess",), {"messages"}), (("--store", "/tmp", "messages", "--fo"), {"--follow"})):
            done = run("bash", "-c", script, "bash", "quarvelctl", *words, env=environment)
            self.assertEqual((set(done.stdout.split()), done.stderr), (offered, ""), words)

    def test_every_error_line_is_explained(self):
        page = re.sub(r"\s+", " ", (SOURCE / "docs/diagnostics.md").read_text())
        missing, lines = [], 0
        for source in self.sources():
            for line in re.finditer(r'ZQ_LOG\([^,]+,\s*error,\s*((?:"(?:[^"\\]|\\.)*"\s*)+)', source):
                text = "".join(re.findall(r'"((?:[^"\\]|\\.)*)"', line[1])).replace('\\"', '"')
                text = re.sub(r"\{[^}]*\}", "…", text)
                if re.search(r"\w", text) and f"`{text}" not in page:
                    missing.append(text)
                lines += 1
        self.assertEqual(missing, [], "not in docs/diagnostics.md")
        self.assertGreater(lines, 30)
