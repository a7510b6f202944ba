"""The installed service's status and counters, and its behaviour on a full disk."""

import contextlib
import os
import shutil
import subprocess
import threading
import time
import unittest

from harness import PATIENCE, SEND, ServiceTest, eventually

CAN_MOUNT = shutil.which("unshare") and subprocess.run(
    ["unshare", "-m", "mount", "-t", "tmpfs", "tmpfs", "/mnt"], capture_output=True, check=False).returncode == 0
FLOOD = 5000  # messages: more than the store's queue, one connection's calls and its socket hold together
# Runs the service with a small file system for its store, which the test reaches through /proc.
ON_SMALL_DISK = ["unshare", "-m", "sh", "-c",
                 'mount -t tmpfs -o size=8m tmpfs "$STATE_DIRECTORY" && exec "$0" "$@"']


class Status(ServiceTest):
    def settled(self, service, accepted):
        """The status once so many rows are accepted and none waits; the counters always add up. One row more
        is the uptime of the client that checked the service's start."""
        def nothing_waits():
            status = service.status()
            counters = status["counters"]
            self.assertEqual(counters["accepted"], counters["stored"] + counters["waiting"]
                             + sum(counters["dropped"].values()), counters)
            settled = counters["accepted"] == accepted + 1 and counters["waiting"] == 0
            return status if settled else None
        return eventually(nothing_waits, "everything is stored or dropped")

    def test_every_message_is_accounted_for_also_after_a_restart(self):
        service = self.service()
        client = self.client(service, session=1)
        client.start_session(2, 11)
        for number in range(20):
            client.message({"n": number}, [1, 2, 3, 0])
        # Each message counts once for each ID, and has an analytics event for each existing session.
        status = self.settled(service, 20 * (4 + 2))
        self.assertTrue(status["healthy"], status)
        self.assertEqual((status["clients"], status["sessions"], status["started_sessions"]), (1, 2, 2))
        self.assertEqual({reason: rows for reason, rows in status["counters"]["dropped"].items() if rows},
                         {"test": 20, "no_such_session": 40})
        self.assertEqual(status["store"]["rows"], service.count("message") + service.count("analytics_event"))
        self.assertEqual(status["store"]["path"], str(service.directory / "state/telemetry.db"))
        client.close()
        service.end()
        service.start()
        # The summaries of both sessions, of which one is a test, and the uptimes of two more clients.
        again = self.settled(service, 20 * (4 + 2) + 2 + 2)
        self.assertEqual(again["counters"]["dropped"]["test"], 21)

    def test_the_status_is_written_on_demand_with_a_verdict_and_files_are_not_public(self):
        service = self.service()
        self.client(service).message({"n": 1}, None)
        self.assertFalse((service.directory / "run/status.json").exists())
        told = service.ctl("status")
        self.assertEqual((told.returncode, told.stderr, told.stdout.splitlines()[0]), (0, "", "healthy"))
        self.assertRegex(told.stdout, r"\d accepted = \d stored \+ \d waiting \+ 0 dropped")
        for name, mode in (("run/status.json", 0o640), ("run/notify", 0o750), ("state/telemetry.db", 0o640),
                           ("state/telemetry.db-wal", 0o640), ("state/telemetry.db-shm", 0o640)):
            self.assertEqual((service.directory / name).stat().st_mode & 0o777, mode, name)
        service.end()
        told = service.ctl("status")
        self.assertEqual((told.returncode, told.stdout), (1, ""))
        self.assertIn("The service does not answer", told.stderr)

    @unittest.skipUnless(CAN_MOUNT, "needs a file system of its own")
    @unittest.skipIf("QUARVEL_VALGRIND" in os.environ, "too slow there to fill the queue of the store")
    def test_a_full_disk_holds_rows_and_senders_and_shows_in_the_status(self):
        service = self.service(wrapper=ON_SMALL_DISK)
        flood, other = self.client(service, session=1), self.client(service, session=2, patience=PATIENCE / 12)
        service_state = f"/proc/{service.process.pid}/root/{service.directory}/state"
        eventually(lambda: service.status()["store_queue"]["rows"] == 0, "both agent sessions are stored")
        with open(f"{service_state}/ballast", "wb") as ballast, contextlib.suppress(OSError):
            for _ in range(4096):
                os.write(ballast.fileno(), bytes(4096))
        sender = threading.Thread(daemon=True, target=lambda: [
            flood.send(SEND, {"n": number, "text": "x" * 100}, 3, 1, [1]) for number in range(FLOOD)])
        sender.start()
        # A checkpoint may make room for a few rows, and the status is healthy again for a moment.
        eventually(lambda: "full" in "".join(service.status()["problems"]), "the full disk in the status")
        eventually(lambda: (told := service.ctl("status")).returncode == 1 and told.stdout.startswith("not healthy\n"),
                   "the tool's verdict")

        def is_full():
            before = service.status()["store_queue"]["rows"]
            time.sleep(0.3)
            return before == service.status()["store_queue"]["rows"] and sender.is_alive()
        eventually(is_full, "the store's queue takes no more of the flood")
        # The I/O thread must not wait for the store: it serves the other clients too.
        for number in range(20):
            other.message({"n": number}, [2])
        eventually(is_full, "the flood is still held")
        time.sleep(1)  # the writer retries several times
        self.assertEqual(service.log().count("fails:"), 1)
        os.unlink(f"{service_state}/ballast")
        sender.join(PATIENCE)
        status = self.settled(service, 2 * (FLOOD + 20))
        self.assertEqual(status["counters"]["stored"], 2 * (FLOOD + 20) + 1)
        self.assertTrue(status["healthy"])
