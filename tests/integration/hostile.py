"""Hostile clients, each in a process of its own, and a polite client beside them."""

import contextlib
import multiprocessing
import os
import socket
import struct
import time

import msgpack
from harness import PATIENCE, SEND, Client


class Hostile:
    """Runs `act(service)` again and again in another process, until `end`."""

    def __init__(self, service, act):
        self._process = multiprocessing.get_context("fork").Process(
            target=self._live, args=(service, act), daemon=True)
        self._process.start()

    @staticmethod
    def _live(service, act):
        os.nice(19)  # the attack itself must not take the processor from the polite client
        while True:
            with contextlib.suppress(OSError):  # refused, disconnected, not read
                act(service)

    def end(self):
        self._process.kill()
        self._process.join(PATIENCE)


class PoliteClient(Client):
    """Sends a message every two milliseconds to session 1 and waits for each answer."""

    def __init__(self, service):
        super().__init__(service)
        self.start_session(1)
        self.sent = 0

    def times(self, seconds):
        """Seconds that each answer took."""
        times = []
        due = time.perf_counter()
        end = due + seconds
        while due < end:
            time.sleep(max(0, due - time.perf_counter()))
            asked = time.perf_counter()
            self.message({"n": self.sent, "route": "Speaker"}, [1])
            times.append(time.perf_counter() - asked)
            self.sent += 1
            due += 0.002
        return times


def raw(service):
    """A connected socket without a client around it."""
    connected = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    # A socket with a time-out of Python's own does not wait while the backlog is full.
    connected.setsockopt(socket.SOL_SOCKET, socket.SO_SNDTIMEO, struct.pack("ll", int(PATIENCE), 0))
    try:
        connected.connect(str(service.socket))
    except OSError:
        connected.close()
        raise
    connected.settimeout(PATIENCE)
    return connected


def notification(method, *arguments):
    return msgpack.packb([2, method, list(arguments)])


def request(number, method, *arguments):
    return msgpack.packb([0, number, method, list(arguments)])


# The attacks. Each runs once, or for a fraction of a second.


def send_bombs(service):
    """Lengths, depths and maps that announce more than follows."""
    head = b"\x94\x00\x01\xd9\x37" + SEND.encode() + b"\x94"
    for bomb in (b"\xdd\xff\xff\xff\xff", b"\x94\x00\x01\xdb\x7f\xff\xff\xff", b"\x94\x00\x01\xa1x" + b"\x91" * 4096,
                 head + b"\xdf\xff\xff\xff\xff", head + b"\x81\xa1k" * 1000, head + b"\xde\xff\xff" + b"\xc0" * 65536,
                 head + b"\xdd\x00\x0f\xff\x00" + b"\xc0" * (1 << 20), b"\xc1"):
        with contextlib.closing(raw(service)) as attacker, contextlib.suppress(ConnectionError):
            attacker.sendall(bomb)
            attacker.shutdown(socket.SHUT_WR)
            while attacker.recv(65536):
                pass


def send_tiny_keys(service, payload={f"{i:x}": 0 for i in range(16384)}):
    with contextlib.closing(Client(service)) as attacker:
        attacker.call("createReportingSession:reply:", 666)
        for _ in range(4):
            attacker.message(payload, [666])


def trickle(service, message=request(1, SEND, {"a": "x" * 1000}, 3, 1, None)):
    """A hundred clients that send one byte at a time."""
    with contextlib.ExitStack() as closing:
        attackers = [closing.enter_context(raw(service)) for _ in range(100)]
        for at in range(50):
            for attacker in attackers:
                attacker.send(message[at:at + 1])
            time.sleep(0.005)


def write_at_full_speed(service, burst=notification(SEND, {"noise": "x" * 200, "n": 1}, 3, 1, [666]) * 1000):
    with contextlib.closing(raw(service)) as attacker:
        attacker.sendall(request(1, "createReportingSession:reply:", 666))
        attacker.sendall(request(2, "startReportingSessionForID:reply:", 666))
        until = time.monotonic() + 0.2
        while time.monotonic() < until:
            attacker.sendall(burst)


def never_read(service, question=request(1, "x" * 60)):
    with contextlib.closing(raw(service)) as attacker:
        attacker.setblocking(False)
        until = time.monotonic() + 0.2
        while time.monotonic() < until:
            try:
                attacker.sendall(question * 1000)
            except BlockingIOError:
                time.sleep(0.001)


def meddle(service):
    """Calls for the sessions of other clients, for no session, and for the least and largest IDs."""
    with contextlib.closing(Client(service)) as attacker:
        for reporter in (1, 0, -1, 2**63 - 1, -2**63):
            for call in (("startReportingSessionForID:reply:", reporter),
                         ("setServiceType:reportingSession:reply:", 11, reporter),
                         ("setConfiguration:forReporterID:reply:", {"HostApplicationDisplayID": "x"}, reporter),
                         ("stopReportingSessionForID:reply:", reporter),
                         ("destroyReportingSession:reply:", reporter)):
                attacker.write(notification(*call))
            attacker.call("reporterID:valid:", reporter)
            attacker.call("getServiceNameForReporterID:reply:", reporter)


def come_and_go(service):
    with contextlib.ExitStack() as closing:
        for _ in range(500):
            closing.enter_context(raw(service))


def broadcast(service):
    """Broadcasts to a thousand sessions of the client, each of which the log lines name."""
    with contextlib.closing(Client(service)) as attacker:
        attacker.write(b"".join(notification("createReportingSession:reply:", n) for n in range(10_000, 11_000)))
        attacker.call("reporterID:valid:", 1)
        for _ in range(10):
            attacker.write(notification(SEND, {"n": 1}, 3, 1, None) * 50)
            attacker.call("reporterID:valid:", 1)


ATTACKS = (send_bombs, send_tiny_keys, trickle, write_at_full_speed, never_read, meddle, come_and_go, broadcast)
