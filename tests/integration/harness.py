"""Starts the installed service in directories of its own, and calls it as any client may."""

import contextlib
import json
import os
import pathlib
import re
import signal
import socket
import sqlite3
import subprocess
import tempfile
import time
import unittest

import msgpack

PREFIX = pathlib.Path(os.environ.get("QUARVEL_PREFIX", "/usr"))
LAUNCH = pathlib.Path(__file__).resolve().parent.parent / "launch"
QUARVELD = (LAUNCH, PREFIX / "sbin/quarveld")
SEND = "sendMessage:withCategory:andType:forReportingIDs:reply:"
# Seconds that an immediate event may take on a slow, busy machine.
PATIENCE = float(os.environ.get("QUARVEL_TEST_PATIENCE", "60"))


def eventually(condition, what, pause=0.01):
    """Waits for a condition that another process brings about; returns the condition's value."""
    deadline = time.monotonic() + PATIENCE
    while True:
        result = condition()
        if result:
            return result
        if time.monotonic() > deadline:
            raise AssertionError(f"never came about: {what}")
        time.sleep(pause)


class Service:
    """A quarveld with directories of its own."""

    def __init__(self, configuration="", wrapper=()):
        self._directory = tempfile.TemporaryDirectory(prefix="quarvel-test-")
        self.directory = pathlib.Path(self._directory.name)
        for name in ("run", "state", "etc/preferences", "diagnostics"):
            (self.directory / name).mkdir(parents=True)
        (self.directory / "etc/quarvel.toml").write_text(configuration)
        self.environment = dict(os.environ, **{variable: str(self.directory / name) for variable, name in (
            ("RUNTIME_DIRECTORY", "run"), ("STATE_DIRECTORY", "state"), ("CONFIGURATION_DIRECTORY", "etc"),
            ("QUARVEL_DIAGNOSTICS_PREFIX", "diagnostics"))})
        for inherited in ("QUARVEL_SOCKET", "LISTEN_FDS", "LISTEN_PID", "JOURNAL_STREAM"):
            self.environment.pop(inherited, None)
        self.socket = self.directory / "run/reporting.sock"
        self.log_path = self.directory / "log"
        self.process, self._wrapper = None, wrapper

    def start(self):
        with open(self.log_path, "ab") as log:
            self.process = subprocess.Popen([*self._wrapper, *QUARVELD], env=self.environment, stderr=log)

        def up():
            if self.process.poll() is not None:
                raise AssertionError(f"quarveld ended: {self.log()}")
            with contextlib.suppress(OSError), contextlib.closing(Client(self)) as client:
                return client.call("getAllReporters:") is not None

        eventually(up, "the service answers")
        return self

    def end(self, how=signal.SIGTERM):
        """Returns the exit status."""
        if self.process.poll() is None:
            self.process.send_signal(how)
        return self.process.wait(PATIENCE)

    def finish(self):
        """Ends the service; fails if a sanitizer or valgrind found something."""
        try:
            if self.process:
                self.end()
        finally:
            if self.process and self.process.poll() is None:
                self.process.kill()
                self.process.wait(PATIENCE)
        if re.search(r"Sanitizer|runtime error:|^==\d+==", self.log(), re.MULTILINE):
            raise AssertionError(self.log())

    def tidy(self):
        self._directory.cleanup()

    def log(self):
        return self.log_path.read_text(errors="replace") if self.log_path.exists() else ""

    def await_log(self, text, count=1):
        eventually(lambda: self.log().count(text) >= count, f"{count} of {text!r} in the log")

    def rows(self, query, *arguments, mode="ro"):
        path = self.directory / "state/telemetry.db"
        with contextlib.closing(sqlite3.connect(f"file:{path}?mode={mode}", uri=True)) as database, database:
            database.row_factory = sqlite3.Row
            return database.execute(query, arguments).fetchall()

    def count(self, query, *arguments):
        return self.rows(f"SELECT count(*) FROM {query}", *arguments)[0][0]

    def wait_for_rows(self, count, query, *arguments):
        eventually(lambda: self.count(query, *arguments) >= count, f"{count} rows of {query}")
        return self.rows(f"SELECT * FROM {query}", *arguments)

    def store_id(self):
        return self.rows("SELECT value FROM meta WHERE key = 'store_id'")[0][0]

    def ctl(self, *arguments):
        return subprocess.run([LAUNCH, PREFIX / "bin/quarvelctl", *map(str, arguments)],
                              env=self.environment, capture_output=True, text=True, timeout=PATIENCE)

    def status(self):
        return json.loads(self.ctl("status", "--json").stdout)

    def reconfigure(self, old, new):
        path = self.directory / "etc/quarvel.toml"
        path.write_text(path.read_text().replace(old, new))

    def prefer(self, text=None, **values):
        """Writes preferences, which take effect with the next `notify`. Replaces the file at once: a file that
        is written in place is empty for a moment."""
        text = text or "".join(f"{key} = {json.dumps(value)}\n" for key, value in values.items())
        path = self.directory / "etc/preferences/tarnwick.quarvel.toml"
        path.with_suffix(".new").write_text(text)
        path.with_suffix(".new").replace(path)

    def notify(self, name="tarnwick.quarvel.reporting"):
        (self.directory / "run/notify" / name).touch()


class Client:
    """One connection. `call` waits for the reply; `send` does not."""

    def __init__(self, service, patience=PATIENCE):
        self._socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self._socket.settimeout(patience)
        try:
            self._socket.connect(str(service.socket))
        except OSError:
            self._socket.close()
            raise
        self.close, self.write = self._socket.close, self._socket.sendall
        self._unpacker = msgpack.Unpacker(raw=False, timestamp=3)
        self._next = 0
        self.replies = {}

    def send(self, method, *arguments):
        self._next += 1
        self.write(msgpack.packb([0, self._next, method, list(arguments)]))
        return self._next

    def receive(self):
        """Reads one more reply and returns its id, or None at the end of the stream."""
        while True:
            for kind, identifier, error, result in self._unpacker:
                assert kind == 1 and identifier not in self.replies
                self.replies[identifier] = (error, result)
                return identifier
            data = self._socket.recv(65536)
            if not data:
                return None
            self._unpacker.feed(data)

    def wait(self, identifier):
        while identifier not in self.replies:
            if self.receive() is None:
                raise AssertionError(f"the connection ended without reply {identifier}")
        error, result = self.replies[identifier]
        if error is not None:
            raise CallError(error)
        return result

    def call(self, method, *arguments):
        return self.wait(self.send(method, *arguments))

    def start_session(self, reporter, service_type=None, configuration=None):
        """Creates and starts; returns the id of the start call, which is answered at the stop."""
        self.call("createReportingSession:reply:", reporter)
        if service_type is not None:
            self.call("setServiceType:reportingSession:reply:", service_type, reporter)
        if configuration is not None:
            self.call("setConfiguration:forReporterID:reply:", configuration, reporter)
        started = self.send("startReportingSessionForID:reply:", reporter)
        self.call("reporterID:valid:", reporter)  # answered after the start was done
        return started

    def message(self, payload, reporters, category=3, kind=1):
        return self.call(SEND, payload, category, kind, reporters)

    def stop_session(self, reporter):
        return self.call("stopReportingSessionForID:reply:", reporter)


class CallError(Exception):
    def __init__(self, error):
        super().__init__(str(error))
        self.domain, self.code = error["domain"], error["code"]
        self.reason = error["userInfo"].get("reason", "")


class ServiceTest(unittest.TestCase):
    def prepared(self, configuration="", **options):
        """A service that is not started yet; it ends with the test."""
        service = Service(configuration, **options)
        self.addCleanup(service.tidy)
        self.addCleanup(service.finish)
        return service

    def service(self, configuration="", **options):
        return self.prepared(configuration, **options).start()

    def client(self, service, session=None, **options):
        """A client, in which `session` has started."""
        client = Client(service, **options)
        self.addCleanup(client.close)
        if session is not None:
            client.start_session(session)
        return client
