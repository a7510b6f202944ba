"""A NATS cluster of three nodes on the loopback, each of which a test can kill."""

import contextlib
import json
import os
import pathlib
import socket
import ssl
import subprocess
import tempfile

from harness import PATIENCE, eventually

DEPLOY = pathlib.Path(__file__).parents[2] / "fleet/nats"


def free_ports(count):
    with contextlib.ExitStack() as stack:
        sockets = [stack.enter_context(socket.socket()) for _ in range(count)]
        for one in sockets:
            one.bind(("127.0.0.1", 0))
        return [one.getsockname()[1] for one in sockets]


class Cluster:
    scheme = "nats"

    def __init__(self):
        self._directory = tempfile.TemporaryDirectory(prefix="quarvel-nats-")
        self.directory = pathlib.Path(self._directory.name)
        self.prepare()
        ports = free_ports(6)
        self.clients, self.routes = ports[:3], ports[3:]
        self.urls = [f"{self.scheme}://127.0.0.1:{port}" for port in self.clients]
        self.nodes = [None] * 3
        for node in range(3):
            self.start(node)

    def start(self, node):
        environment = dict(
            os.environ, QUARVEL_NODE=f"n{node}", QUARVEL_STORE=str(self.directory / f"n{node}"),
            QUARVEL_LISTEN=f"127.0.0.1:{self.clients[node]}", QUARVEL_CLUSTER=f"127.0.0.1:{self.routes[node]}",
            **{f"QUARVEL_ROUTE_{i + 1}": f"nats://127.0.0.1:{port}" for i, port in enumerate(self.routes)})
        with open(self.directory / f"n{node}.log", "ab") as log:
            self.nodes[node] = subprocess.Popen(
                ["nats-server", *self.arguments(node)], env=environment, stdout=log, stderr=log)

    def prepare(self):
        pass

    def arguments(self, _node):
        return ["-c", DEPLOY / "trial.conf"]

    def secured(self, peer):
        return peer

    def kill(self, node):
        self.nodes[node].kill()
        self.nodes[node].wait(PATIENCE)

    def close(self):
        for node in range(3):
            self.kill(node)
        self._directory.cleanup()

    def rows(self, consumer):
        """The rows that the consumer prints up to the stream's end."""
        def read():
            for url in self.urls:
                ran = subprocess.run([consumer, url, "QUARVEL", "--until-empty"], capture_output=True, text=True,
                                     timeout=300, check=False)
                if ran.returncode == 0:
                    return [json.loads(line) for line in ran.stdout.splitlines()]
            return None
        return eventually(read, "the consumer reads the stream", 0.1)

    def create_stream(self):
        """Creates the stream as soon as the cluster has a leader."""
        wanted = {"name": "QUARVEL", "subjects": ["quarvel.>"], "num_replicas": 3, "storage": "file",
                  "retention": "limits", "discard": "old"}
        eventually(lambda: "config" in self.ask("$JS.API.STREAM.CREATE.QUARVEL", json.dumps(wanted)),
                   "the stream", 0.1)

    def state(self):
        """The stream's state, with its counts of "messages" and "bytes"."""
        return eventually(lambda: self.ask("$JS.API.STREAM.INFO.QUARVEL").get("state"), "the stream's state", 0.1)

    def ask(self, subject, body=""):
        """The answer to a request; an empty one if no server answers."""
        with contextlib.suppress(OSError), socket.create_connection(("127.0.0.1", self.clients[0]), 5) as peer:
            while peer.recv(1) != b"\n":
                pass  # the server's INFO line comes first, before TLS
            with self.secured(peer) as talking:
                reader = talking.makefile("rb")
                talking.sendall('CONNECT {{"verbose":false}}\r\nSUB _INBOX.q 1\r\nPUB {} _INBOX.q {}\r\n{}\r\n'
                                .format(subject, len(body), body).encode())
                for line in reader:
                    if line.startswith(b"MSG "):
                        return json.loads(reader.read(int(line.split()[-1])))
        return {}


class SecuredCluster(Cluster):
    """A cluster with the configuration of node.conf, and certificates of its own."""

    scheme = "tls"

    def prepare(self):
        text = (DEPLOY / "node.conf").read_text()
        text = text.replace("/etc/nats/", f"{self.directory}/").replace("500GB", "1GB").replace("1GB", "64MB", 1)
        for node in range(3):
            (self.directory / f"{node}.conf").write_text(text.replace("/var/lib/nats", f"{self.directory}/n{node}"))
        self.openssl("req", "-x509", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=authority", "-days", "2",
                     "-keyout", "ca.key", "-out", "ca.pem")
        for name in ("node", "car-7", "operator"):
            self.openssl("req", "-newkey", "rsa:2048", "-nodes", "-subj", f"/CN={name}", "-keyout", f"{name}.key",
                         "-out", f"{name}.csr")
            (self.directory / "extensions").write_text("subjectAltName=IP:127.0.0.1\n")
            self.openssl("x509", "-req", "-in", f"{name}.csr", "-CA", "ca.pem", "-CAkey", "ca.key", "-CAcreateserial",
                         "-days", "2", "-extfile", "extensions", "-out", f"{name}.pem")

    def openssl(self, *arguments):
        subprocess.run(["openssl", *arguments], cwd=self.directory, check=True, capture_output=True, timeout=PATIENCE)

    def arguments(self, node):
        return ["-c", self.directory / f"{node}.conf", "-a", "127.0.0.1", "-p", str(self.clients[node]), "-m", "0",
                "--cluster_listen", f"nats://127.0.0.1:{self.routes[node]}"]

    def secured(self, peer):
        context = ssl.create_default_context(cafile=self.directory / "ca.pem")
        context.load_cert_chain(self.directory / "operator.pem", self.directory / "operator.key")
        return context.wrap_socket(peer, server_hostname="127.0.0.1")
