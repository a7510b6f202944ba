"""The service with a NATS cluster of three nodes, while nodes and the service are killed."""

import collections
import json
import os
import random
import signal
import time

from cluster import Cluster, SecuredCluster
from harness import ServiceTest, eventually

NIGHTLY = bool(os.environ.get("QUARVEL_NIGHTLY"))
TABLES = "agent_session", "message", "analytics_event", "power_event"


def configuration(cluster, device="car-7", window=600, create="true"):
    return f"""
        store.sync_ms = 20
        analytics.wanted = []
        [agent]
        backends = ["nats"]
        device = "{device}"
        drain_rows_per_second = 20000
        [agent.nats]
        urls = {json.dumps(cluster.urls)}
        create_stream = {create}
        duplicate_window_seconds = {window}
        acknowledge_seconds = 5
        """


class Nats(ServiceTest):
    def setUp(self):
        self.cluster = Cluster()
        self.addCleanup(self.cluster.close)

    def names(self, service):
        """The names of every row that the store holds."""
        return [f"{service.store_id()}-{table}-{row[0]}" for table in TABLES
                for row in service.rows(f"SELECT id FROM {table} ORDER BY id")]

    def await_export(self, service):
        def settled():
            before = len(self.names(service))
            time.sleep(0.3)
            return 0 < before == len(self.names(service))
        eventually(settled, "everything is stored")
        eventually(lambda: all(
            service.rows(f"SELECT (SELECT ifnull(max(id), 0) FROM {table}) <= (SELECT ifnull(max(exported_through), 0)"
                         " FROM backend_cursor WHERE table_name = ?)", table)[0][0]
            for table in TABLES), "all is exported")

    def test_every_row_arrives_once_while_nodes_and_the_service_are_killed(self):
        rows = 100_000 if NIGHTLY else 20_000
        dice = random.Random(7)
        service = self.service(configuration(self.cluster))
        killed = []
        sent = 0
        for turn in range(8):
            client = self.client(service, session=turn + 1)
            for _ in range(rows // 8):
                sent += 1
                client.message({"n": sent, "route": "speaker", "text": "x" * 150}, [turn + 1])
            if turn == 1:
                killed.append(dice.randrange(3))
                self.cluster.kill(killed[-1])
            if turn == 4:
                self.cluster.start(killed[-1])
            if turn in (2, 3, 5, 6):
                time.sleep(dice.random())
                service.end(signal.SIGKILL)
                service.start()
        self.await_export(service)
        names = self.names(service)
        self.assertGreaterEqual(len(names), rows - 4 * 1024)  # a kill may lose the rows of the last moment
        arrived = self.cluster.rows(os.environ["QUARVEL_CONSUMER"])
        self.assertEqual(sorted(row["name"] for row in arrived), sorted(names))
        self.assertEqual(self.cluster.state()["messages"], len(names), "the stream itself has dropped the repeats")
        self.assertEqual({row["subject"] for row in arrived if "-message-" in row["name"]}, {"quarvel.car-7.message"})
        stored = {row["id"]: json.loads(row["payload"]) for row in service.rows("SELECT id, payload FROM message")}
        self.assertEqual({row["row"]["id"]: row["row"]["payload"] for row in arrived if "-message-" in row["name"]},
                         stored)

    def test_a_repeat_after_the_streams_window_is_dropped_by_the_consumer(self):
        service = self.service(configuration(self.cluster, window=1))
        client = self.client(service, session=1)
        for number in range(300):
            client.message({"n": number}, [1])
        self.await_export(service)
        before = self.cluster.state()["messages"]
        for wait, repeats in ((2, 100), (0, 100)):
            # The state after a crash between the acknowledgement and the cursor's commit.
            service.end(signal.SIGKILL)
            service.rows("UPDATE backend_cursor SET exported_through = exported_through - 100 WHERE table_name = "
                         "'message'", mode="rw")
            time.sleep(wait)
            service.start()
            self.await_export(service)
        self.assertGreaterEqual(self.cluster.state()["messages"], before + repeats)
        names = collections.Counter(row["name"] for row in self.cluster.rows(os.environ["QUARVEL_CONSUMER"]))
        self.assertEqual(sorted(names.elements()), sorted(self.names(service)))

    def test_rows_too_large_for_the_stream_are_refused_with_a_reason(self):
        service = self.service(configuration(self.cluster, create="false"))
        self.client(service, session=1)
        service.await_log("no stream QUARVEL")
        service.end()
        service.reconfigure("create_stream = false", "create_stream = true")
        client = self.client(service.start(), session=2)
        client.message({"n": 1}, [2])
        client.message({"text": "\x01" * 400_000}, [2])  # six bytes each in JSON
        client.message({"n": 2}, [2])
        self.await_export(service)
        outcomes = [(row["first_id"], row["outcome"]) for row in service.rows(
            "SELECT * FROM export_log WHERE table_name = 'message' AND outcome != 'acknowledged'")]
        large = service.rows("SELECT id FROM message WHERE length(payload) > 1000000")[0][0]
        self.assertEqual([line[0] for line in outcomes], [large])
        self.assertRegex(outcomes[0][1], "^refused: [0-9]+ bytes are more than it allows")
        self.assertEqual(len(self.cluster.rows(os.environ["QUARVEL_CONSUMER"])), len(self.names(service)) - 1)


class SecuredNats(ServiceTest):
    def test_a_device_publishes_below_its_own_name_and_nowhere_else(self):
        cluster = SecuredCluster()
        self.addCleanup(cluster.close)
        cluster.create_stream()
        files = "".join(f'{key} = "{cluster.directory}/{file}"\n' for key, file in
                        (("tls_ca", "ca.pem"), ("tls_certificate", "car-7.pem"), ("tls_key", "car-7.key")))
        for device, allowed in (("car-7", True), ("car-8", False)):
            service = self.service(configuration(cluster, device, create="false") + files)
            self.client(service, session=1)
            if allowed:
                service.wait_for_rows(1, "export_log WHERE outcome = 'acknowledged'")
            else:
                service.await_log("takes no rows")
                self.assertEqual(service.count("export_log"), 0)
        self.assertEqual(cluster.state()["messages"], 1)
