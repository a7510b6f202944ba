"""Builds the examples against the installed files and runs each with the installed service."""

import json
import pathlib
import subprocess
import sys
import tempfile
import unittest

from harness import LAUNCH, PATIENCE, PREFIX, ServiceTest

SOURCES = pathlib.Path(sys.argv.pop(1))


class Examples(ServiceTest):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory(prefix="quarvel-examples-")
        cls.addClassCleanup(directory.cleanup)
        cls.built = pathlib.Path(directory.name)
        for command in (["cmake", "-S", SOURCES, "-B", cls.built, f"-DCMAKE_PREFIX_PATH={PREFIX}",
                         "-DCMAKE_COMPILE_WARNING_AS_ERROR=ON"], ["cmake", "--build", cls.built]):
            built = subprocess.run(command, capture_output=True, text=True)
            assert built.returncode == 0, built.stdout + built.stderr

    def run_example(self, *command):
        """Returns its output and the payloads of the session that it has reported."""
        service = self.service()
        ended = subprocess.run([*command, service.socket], capture_output=True, text=True, timeout=PATIENCE)
        self.assertEqual((ended.returncode, ended.stderr), (0, ""))
        session = service.wait_for_rows(1, "agent_session WHERE flushed_at IS NOT NULL")[0]
        rows = service.rows("SELECT * FROM message WHERE agent_session = ? ORDER BY id", session["id"])
        self.assertEqual(len(rows), service.count("message"), "every message belongs to the session")
        # The last one is the session's summary.
        return ended.stdout, session["service_name"], [json.loads(row["payload"]) for row in rows[:-1]]

    def test_each(self):
        c = [{"number": number, "route": "Speaker", "rates": [44100, 48000]} for number in range(1, 6)]
        cc = [{"number": number, "route": "Receiver"} for number in (1, 2, 3)] + [{"volume": 0.5}]
        for command, said, service, key, reported in (
                ([LAUNCH, self.built / "client-c"], "has stopped", "longformaudio", None, c),
                ([LAUNCH, self.built / "client-cc"], "started: true\nstopped: true\n", "telephony", None, cc),
                ([LAUNCH, self.built / "realtime"], "200 records sent\n", "audiodeviceusage", "callback",
                 list(range(200))),
                ([sys.executable, SOURCES / "client.py"], "destroy: True", "longformaudio", "route", ["Speaker"])):
            with self.subTest(str(command[-1])):
                output, service_name, payloads = self.run_example(*command)
                self.assertIn(said, output)
                self.assertIn(service, service_name)
                self.assertEqual([payload[key] if key else payload for payload in payloads], reported)


if __name__ == "__main__":
    unittest.main()
