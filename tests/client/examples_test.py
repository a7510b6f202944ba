"""Builds the examples against the installed files and runs each with the installed service."""

import json
import pathlib
import subprocess
import sys
import tempfile
import unittest

from harness import LAUNCH, PATIENCE, PREFIX, ServiceTest, eventually

SOURCES = pathlib.Path(sys.argv.pop(1))


class Examples(ServiceTest):
    @classmethod
    def setUpClass(cls):
        directory = tempfile.TemporaryDirectory(prefix="quarvel-examples-")
        cls.addClassCleanup(directory.cleanup)
        cls.built = pathlib.Path(directory.name)
        for command in (
            ["cmake", "-S", SOURCES, "-B", cls.built, f"-DCMAKE_PREFIX_PATH={PREFIX}",
             "-DCMAKE_COMPILE_WARNING_AS_ERROR=ON"],
            ["cmake", "--build", cls.built],
        ):
            built = subprocess.run(command, capture_output=True, text=True)
            assert built.returncode == 0, built.stdout + built.stderr

    def run_example(self, *command):
        """Returns its output and the payloads of the session that it has reported."""
        service = self.service()
        ended = subprocess.run([*command, service.socket], capture_output=True, text=True, timeout=PATIENCE)
        self.assertEqual(ended.returncode, 0, ended.stderr)
        self.assertEqual(ended.stderr, "")
        session = service.wait_for_rows(1, "agent_session WHERE flushed_at IS NOT NULL")[0]
        rows = service.rows("SELECT * FROM message WHERE agent_session = ? ORDER BY id", session["id"])
        self.assertEqual(len(rows), service.count("message"), "every message belongs to the session")
        # The last one is the session's summary.
        return ended.stdout, session["service_name"], [json.loads(row["payload"]) for row in rows[:-1]]

    def test_c_on_an_event_loop(self):
        output, service_name, payloads = self.run_example(LAUNCH, self.built / "client-c")
        self.assertIn("has stopped", output)
        self.assertIn("longformaudio", service_name)
        self.assertEqual(payloads, [{"number": number, "route": "Speaker", "rates": [44100, 48000]}
                                    for number in range(1, 6)])

    def test_cc(self):
        output, service_name, payloads = self.run_example(LAUNCH, self.built / "client-cc")
        self.assertEqual(output, "started: true\nstopped: true\n")
        self.assertIn("telephony", service_name)
        self.assertEqual(payloads, [{"number": number, "route": "Receiver"} for number in (1, 2, 3)]
                         + [{"volume": 0.5}])

    def test_realtime(self):
        output, service_name, payloads = self.run_example(LAUNCH, self.built / "realtime")
        self.assertEqual(output, "200 records sent\n")
        self.assertIn("audiodeviceusage", service_name)
        self.assertEqual([payload["callback"] for payload in payloads], list(range(200)))

    def test_python(self):
        output, service_name, payloads = self.run_example(sys.executable, SOURCES / "client.py")
        self.assertIn("destroy: True", output)
        self.assertIn("longformaudio", service_name)
        self.assertEqual([payload["route"] for payload in payloads], ["Speaker"])


if __name__ == "__main__":
    unittest.main()
