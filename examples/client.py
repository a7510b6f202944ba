#!/usr/bin/python3
"""One whole reporting session over a plain socket.

Usage: client.py [SOCKET]    (else $QUARVEL_SOCKET, else /run/quarvel/reporting.sock)
"""

import datetime
import os
import random
import socket
import sys

import msgpack  # Debian: python3-msgpack


class Client:
    def __init__(self, path):
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.socket.settimeout(30)
        self.socket.connect(path)
        self.unpacker = msgpack.Unpacker(timestamp=3)  # dates as datetime
        self.last_id = 0
        self.replies = {}

    def call(self, method, *arguments):
        """Sends a call and returns its id; the reply may come much later."""
        self.last_id += 1
        request = [0, self.last_id, method, arguments]
        self.socket.sendall(msgpack.packb(request, datetime=True))
        return self.last_id

    def reply(self, call):
        """Waits for the reply to one call; those to others are kept until they are asked for."""
        while call not in self.replies:
            received = self.socket.recv(65536)
            if not received:
                sys.exit("the service has gone")
            self.unpacker.feed(received)
            for _, answered, error, result in self.unpacker:
                self.replies[answered] = error, result
        error, result = self.replies.pop(call)
        if error is not None:
            sys.exit(f"error {error['code']} of {error['domain']}: {error['userInfo']}")
        return result


def expect(what, answer, expected):
    print(f"{what}: {answer}")
    if answer != expected:
        sys.exit(f"{what}: expected {expected}")


def main():
    path = os.environ.get("QUARVEL_SOCKET", "/run/quarvel/reporting.sock")
    client = Client(sys.argv[1] if len(sys.argv) > 1 else path)
    session = random.randint(1, 2**63 - 1)  # sessions of all clients share one space of ids

    create = client.call("createReportingSession:reply:", session)
    expect("create", client.reply(create), True)

    long_form_audio = 7
    set_type = client.call("setServiceType:reportingSession:reply:", long_form_audio, session)
    expect("set the service type", client.reply(set_type), True)

    configuration = {"HostApplicationDisplayID": "org.example.player"}
    configure = client.call("setConfiguration:forReporterID:reply:", configuration, session)
    expect("configure", client.reply(configure), True)

    start = client.call("startReportingSessionForID:reply:", session)  # answered at the stop

    hal_playback, start_type = 0x2000_0000 | 3, 1
    message = {
        "sample_rate": 48000.0,
        "io_buffer_frames": 512,
        "route": "Speaker",
        "zqreporting_timestamp": datetime.datetime.now(datetime.timezone.utc),
    }
    send = client.call(
        "sendMessage:withCategory:andType:forReportingIDs:reply:",
        message, hal_playback, start_type, [session],
    )
    expect("send", client.reply(send), None)

    valid = client.call("reporterID:valid:", session)
    expect("look up", client.reply(valid), {"reporterID": session, "serviceType": long_form_audio})

    stop = client.call("stopReportingSessionForID:reply:", session)
    expect("stop", client.reply(stop), True)
    expect("start", client.reply(start), True)

    destroy = client.call("destroyReportingSession:reply:", session)
    expect("destroy", client.reply(destroy), True)


if __name__ == "__main__":
    main()
