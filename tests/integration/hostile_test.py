"""A hostile client delays no other client by a second, memory stays bounded, and limits hold.

bench/hostile_bench.py measures how much a hostile client costs the others."""

import contextlib
import os
import pathlib
import resource
import time

import hostile
import msgpack
from harness import ServiceTest, eventually

SECONDS = 20 if os.environ.get("QUARVEL_NIGHTLY") else 1.5
MOST_MEMORY = 256  # MiB
SHORT_LIMITS = "[limits]\nframe_seconds = 1\nstall_seconds = 1\n"


def figure(name, text):
    print(f"harness: hostile: {name}: {text}", flush=True)


def resident(process, peak=False):
    """Memory in MiB."""
    key = "VmHWM:" if peak else "VmRSS:"
    for line in pathlib.Path(f"/proc/{process.pid}/status").read_text().splitlines():
        if line.startswith(key):
            return int(line.split()[1]) / 1024
    raise AssertionError(key)


class Beside(ServiceTest):
    """A polite client beside a hostile client that repeats its attack all the time."""

    def beside(self, act):
        service = self.service(SHORT_LIMITS)
        polite = hostile.PoliteClient(service)
        self.addCleanup(polite.close)
        attacker = hostile.Hostile(service, act)
        self.addCleanup(attacker.end)
        for _ in range(3):  # a busy machine may hold up one answer
            slowest = max(polite.times(SECONDS))
            if slowest < 1:
                break
        memory = resident(service.process, peak=True)
        figure(act.__name__, f"slowest answer {slowest * 1000:.1f} ms, {memory:.0f} MB")
        self.assertLess(slowest, 1)
        self.assertLess(memory, MOST_MEMORY)
        attacker.end()
        polite.stop_session(1)
        polite.close()
        service.end()
        rows = service.rows("SELECT id, json_extract(payload, '$.n') AS n FROM message WHERE session_id = 1 "
                            "AND category = 3 AND payload LIKE '%Speaker%' ORDER BY id")
        # Retention may remove the oldest rows of all clients; no other row may be missing.
        oldest = service.rows("SELECT min(id) FROM message")[0][0]
        first = 0 if oldest == 1 else polite.sent - len(rows)
        self.assertEqual([row["n"] for row in rows], list(range(first, polite.sent)))

    def test_every_attack(self):
        for act in hostile.ATTACKS:
            with self.subTest(act.__name__):
                self.beside(act)
                self.doCleanups()


class Numbers(ServiceTest):
    def setUp(self):
        soft, hard = resource.getrlimit(resource.RLIMIT_NOFILE)
        self.addCleanup(resource.setrlimit, resource.RLIMIT_NOFILE, (soft, hard))
        resource.setrlimit(resource.RLIMIT_NOFILE, (hard, hard))
        self.most = min(10_000, hard - 200)

    def connect(self, service, count):
        """Returns an ExitStack of connections, and the last one."""
        connected = self.enterContext(contextlib.ExitStack())
        for _ in range(count):
            last = connected.enter_context(hostile.raw(service))
        return connected, last

    def idles(self, service):
        """Whether the service uses less than a fifth of a core while no client calls."""
        def ticks():
            fields = pathlib.Path(f"/proc/{service.process.pid}/stat").read_text().rpartition(") ")[2].split()
            return int(fields[11]) + int(fields[12])
        before = ticks()
        time.sleep(1)
        return ticks() - before < 0.2 * os.sysconf("SC_CLK_TCK")

    def test_ten_thousand_connections(self):
        service = self.service(f"[limits]\nconnections = {self.most + 10}\n")
        polite = self.client(service, session=1)
        began = time.monotonic()
        _, last = self.connect(service, self.most)
        eventually(lambda: len(os.listdir(f"/proc/{service.process.pid}/fd")) > self.most, "all are accepted")
        figure("connections", f"{self.most} in {time.monotonic() - began:.1f} s, {resident(service.process):.0f} MB")
        polite.message({"beside": self.most}, [1])
        last.sendall(hostile.request(1, "getAllReporters:"))
        self.assertEqual(last.recv(100), msgpack.packb([1, 1, None, [1]]))
        eventually(lambda: self.idles(service), "an idle service")
        self.assertLess(resident(service.process), MOST_MEMORY)

    def test_at_a_limit_clients_wait_and_the_service_does_not_spin(self):
        limits = {"of connections": ("[limits]\nconnections = 100\n", (), 300),
                  "of descriptors": ("", ("prlimit", "--nofile=256"), 400)}
        for name, (configuration, wrapper, count) in limits.items():
            with self.subTest(name):
                service = self.service(configuration, wrapper=wrapper)
                polite = self.client(service, session=1)
                connected, _ = self.connect(service, count)
                waiting = self.client(service)
                asked = waiting.send("getAllReporters:")
                service.await_log("no further client is accepted")
                polite.message({"at": name}, [1])
                eventually(lambda: self.idles(service), "a service that waits")
                self.assertNotIn(asked, waiting.replies)
                connected.close()
                self.assertEqual(waiting.wait(asked), [1], "the waiting client is served")
                self.assertEqual(service.log().count("no further client is accepted"), 1)

    def test_a_hundred_thousand_sessions(self):
        service = self.service()
        polite = self.client(service, session=1)
        attacker = self.client(service)
        sessions, threads = 100_000, 0
        began = time.monotonic()
        for first in range(2, sessions, 1000):
            attacker.write(b"".join(hostile.notification(call, reporter)
                                    for reporter in range(first, min(first + 1000, sessions + 1))
                                    for call in ("createReportingSession:reply:", "startReportingSessionForID:reply:")))
            threads = max(threads, len(os.listdir(f"/proc/{service.process.pid}/task")))
            polite.message({"beside": first}, [1])
        self.assertEqual(len(attacker.call("getAllReporters:")), sessions)
        figure("sessions", f"{sessions} started in {time.monotonic() - began:.1f} s, "
                           f"{resident(service.process):.0f} MB, {threads} threads at most")
        self.assertLess(resident(service.process), 2 * MOST_MEMORY)
        self.assertLess(threads, 4000)
        attacker.close()
        eventually(lambda: polite.call("getAllReporters:") == [1], "all of them are gone")


class Deadlines(ServiceTest):
    def test_the_defaults(self):
        """An incomplete frame ends its connection after 10 s, unread replies after 30 s and at 1 MiB."""
        service = self.service()
        polite = self.client(service)
        slow, deaf = (self.enterContext(hostile.raw(service)) for _ in range(2))
        began = time.monotonic()
        slow.send(b"\x94")
        deaf.setblocking(False)
        with contextlib.suppress(BlockingIOError):
            while True:
                deaf.send(hostile.request(1, "x" * 60) * 100)
        slow.recv(1)
        frame_seconds = time.monotonic() - began
        eventually(lambda: polite.call("getAllReporters:") == [] and
                   "does not read its replies" in service.log(), "the client that does not read is disconnected")
        stall_seconds = time.monotonic() - began
        figure("deadlines", f"a frame {frame_seconds:.1f} s, unread replies {stall_seconds:.1f} s")
        self.assertGreater(frame_seconds, 9.5)
        self.assertGreater(stall_seconds, 29.5)
        self.assertLess(frame_seconds, stall_seconds)
        self.assertLess(resident(service.process, peak=True), 64)
