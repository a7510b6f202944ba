"""The installed service under a service manager: socket activation, notifications, watchdog, sandbox."""

import re
import socket
import subprocess
import unittest

from harness import PATIENCE, PREFIX, QUARVELD, ServiceTest, eventually

UNITS = PREFIX / "lib/systemd/system"


class Manager(ServiceTest):
    def test_it_notifies_ready_pings_the_watchdog_notifies_stopping_and_nothing_else(self):
        service = self.prepared()
        path = service.directory / "notify.sock"
        heard = self.enterContext(socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM))
        heard.bind(str(path))
        heard.settimeout(PATIENCE)
        service.environment.update(NOTIFY_SOCKET=str(path), WATCHDOG_USEC="200000")
        service.start()
        self.assertEqual([heard.recv(100) for _ in range(5)], [b"READY=1"] + [b"WATCHDOG=1"] * 4)
        self.assertEqual(service.end(), 0)
        while (last := heard.recv(100)) == b"WATCHDOG=1":
            pass
        self.assertEqual(last, b"STOPPING=1")
        (service.directory / "etc/quarvel.toml").write_text('[log]\nlevel = "loud"\n')
        refused = subprocess.run(QUARVELD, env=service.environment, stderr=subprocess.DEVNULL, timeout=PATIENCE)
        self.assertEqual(refused.returncode, 1)
        heard.setblocking(False)
        with self.assertRaises(BlockingIOError):
            heard.recv(100)

    def test_a_socket_that_is_passed_in_outlives_the_service(self):
        service = self.prepared()
        arguments = ["systemd-socket-activate", "-l", service.socket, "--fdname=reporting"]
        for name in ("RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY",
                     "QUARVEL_DIAGNOSTICS_PREFIX", "ASAN_OPTIONS"):
            if name in service.environment:
                arguments.append(f"--setenv={name}={service.environment[name]}")
        with open(service.log_path, "wb") as log:
            # The program of the unit, below the test's prefix.
            program = re.search("^ExecStart=/usr/(.*)$", (UNITS / "quarvel.service").read_text(), re.MULTILINE)[1]
            service.process = subprocess.Popen([*arguments, PREFIX / program], stderr=log)
        eventually(service.socket.exists, "the socket")
        self.assertNotIn("quarveld", service.log(), "no client has connected")
        client = self.client(service, session=5)
        client.message({"first": True}, [5])
        self.assertTrue((service.directory / "run/notify").is_dir(), "notifications can be posted")
        self.assertEqual(service.end(), 0)
        self.assertEqual(service.count("message WHERE session_id = 5"), 2, "and the summary")
        self.assertTrue(service.socket.exists(), "it belongs to the service manager")


class Units(unittest.TestCase):
    def test_the_service_is_sandboxed(self):
        # An exposure of at most 1.5, given in tenths; 10.0 is a service without any sandbox.
        done = subprocess.run(["systemd-analyze", "security", "--offline=yes", "--no-pager", "--threshold=15",
                               UNITS / "quarvel.service"], capture_output=True, text=True, timeout=PATIENCE)
        self.assertEqual(done.returncode, 0, done.stdout + done.stderr)
