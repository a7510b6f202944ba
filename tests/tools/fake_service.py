"""A service for the tests of the tools: speaks the wire with an ordinary MessagePack library."""

import os
import socket
import threading

import msgpack

START = "startReportingSessionForID:reply:"
STOP = "stopReportingSessionForID:reply:"
VALID = "reporterID:valid:"
REPORTERS = "getAllReporters:"
KILL = "killService:"


class FakeService:
    """Answers the calls of one client after another. A start is answered when its session stops."""

    def __init__(self, path, reporters=()):
        self.path = path
        self.reporters = dict(reporters)
        self.calls = []  # [method, arguments] in the order received
        self._listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self._listener.bind(path)
        self._listener.listen()
        self._thread = threading.Thread(target=self._serve)
        self._thread.start()

    def close(self):
        self._listener.shutdown(socket.SHUT_RDWR)
        self._thread.join()
        self._listener.close()
        os.unlink(self.path)

    def _serve(self):
        while True:
            try:
                connection, _ = self._listener.accept()
            except OSError:
                return
            with connection:
                self._serve_client(connection)

    def _serve_client(self, connection):
        unpacker = msgpack.Unpacker(timestamp=3, strict_map_key=False)
        starts = {}
        while received := connection.recv(65536):
            unpacker.feed(received)
            for _, call, method, arguments in unpacker:
                self.calls.append([method, arguments])
                if method == KILL:
                    return
                for response in self._responses(call, method, arguments, starts):
                    connection.sendall(msgpack.packb(response))

    def _responses(self, call, method, arguments, starts):
        if method == START:
            starts[arguments[0]] = call
        elif method == STOP:
            yield [1, call, None, True]
            if arguments[0] in starts:
                yield [1, starts.pop(arguments[0]), None, True]
        elif method == VALID:
            known = arguments[0] in self.reporters
            yield [1, call, None, {"reporterID": arguments[0] if known else 0,
                                   "serviceType": self.reporters.get(arguments[0], 65535)}]
        elif method == REPORTERS:
            yield [1, call, None, list(self.reporters)]
        elif method == "unknown":
            yield [1, call, {"domain": "quarvel.connection", "code": 1,
                             "userInfo": {"reason": "There is no such operation."}}, None]
        else:
            yield [1, call, None, True]
