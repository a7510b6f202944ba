"""The service with a strict OTLP/HTTP collector: the records that arrive, and the handling of each answer."""

import datetime
import json
import math
import os
import subprocess
import threading
import time
import urllib.request

import msgpack
from harness import PATIENCE, ServiceTest, eventually

CONFIGURATION = """
store.sync_ms = 0
analytics.wanted = []
[agent]
backends = ["otlp"]
device = "bench-1"
[agent.otlp]
endpoint = "http://127.0.0.1:{port}"
headers = {{ X-Fleet = "north" }}
timeout_seconds = 2
"""


class Collector:
    def __init__(self):
        self.process = subprocess.Popen(
            ["node", f"{os.environ['QUARVEL_RECEIVER']}/receiver.js"], stdout=subprocess.PIPE, text=True)
        self.port = int(self.process.stdout.readline())
        self.lines = []
        self._reader = threading.Thread(daemon=True, target=lambda: self.lines.extend(
            map(json.loads, self.process.stdout)))
        self._reader.start()

    def close(self):
        self.process.kill()
        self.process.wait(PATIENCE)
        self._reader.join(PATIENCE)
        self.process.stdout.close()

    def tell(self, what, body):
        urllib.request.urlopen(f"http://127.0.0.1:{self.port}/{what}", data=body.encode(),
                               timeout=PATIENCE).close()

    def answer(self, *answers):
        self.tell("answers", json.dumps(answers))

    def records(self):
        """The messages of the requests that were answered with 200 and an empty object."""
        return [record for line in list(self.lines) if line["answer"] == {"status": 200, "body": "{}"}
                for resource in line["request"]["resourceLogs"] for scope in resource["scopeLogs"]
                for record in scope["logRecords"]
                if attributes(record)["quarvel.table"] == {"stringValue": "message"}]

    def bodies(self):
        return [plain(record["body"]) for record in self.records()]


def plain(value):
    """Converts an AnyValue into a Python value; a whole double stays a float."""
    kind, content = next(iter(value.items()), (None, None))
    if kind == "kvlistValue":
        return {entry["key"]: plain(entry["value"]) for entry in content.get("values", [])}
    if kind == "arrayValue":
        return [plain(item) for item in content.get("values", [])]
    if kind == "intValue":
        return int(content)
    return float(content) if kind == "doubleValue" else content


def attributes(record):
    return {entry["key"]: entry["value"] for entry in record["attributes"]}


class Otlp(ServiceTest):
    def setUp(self):
        self.collector = Collector()
        self.addCleanup(self.collector.close)

    def started(self):
        """Returns a service and a client with session 5, which is exported."""
        service = self.service(CONFIGURATION.format(port=self.collector.port))
        client = self.client(service, session=5)
        service.wait_for_rows(1, "export_log WHERE table_name = 'agent_session'")
        return service, client

    def ledger(self, service):
        return [(row["first_id"], row["last_id"], row["outcome"]) for row in
                service.rows("SELECT * FROM export_log WHERE table_name = 'message' ORDER BY id")]

    def test_records_carry_the_row_and_every_kind_of_value(self):
        service = self.service(CONFIGURATION.format(port=self.collector.port))
        client = self.client(service)
        when = datetime.datetime(2026, 1, 31, 12, 0, 0, 5, tzinfo=datetime.timezone.utc)
        sent = {"least": -2**63, "most": 2**64 - 1, "half": 0.5, "whole": 2.0, "yes": True, "none": None,
                "nan": math.nan, "endless": -math.inf, "empty": {}, "nothing": [], "bytes": b"\x00\xff",
                "when": msgpack.Timestamp.from_datetime(when), "nested": [[1, [{}]], {"a": {"b": [2]}}],
                7: "\u00e4\n\"\\", "": ""}
        started = client.start_session(-2**63, 2, {"App": "x"})
        client.message(sent, [-2**63], category=0x10000003, kind=4)
        eventually(self.collector.records, "the message")
        service.wait_for_rows(1, "export_log WHERE table_name = 'message'")
        self.assertEqual([line["fault"] for line in self.collector.lines if "fault" in line], [])
        line = self.collector.lines[-1]
        self.assertEqual((line["path"], line["headers"]["x-fleet"], line["headers"]["content-encoding"]),
                         ("/v1/logs", "north", "gzip"))
        resource = attributes(line["request"]["resourceLogs"][0]["resource"])
        store = service.store_id()
        self.assertEqual({key: value["stringValue"] for key, value in resource.items() if key != "service.version"},
                         {"service.name": "quarveld", "service.instance.id": store, "host.name": "bench-1"})
        self.assertEqual(line["request"]["resourceLogs"][0]["scopeLogs"][0]["scope"]["name"], "tarnwick.quarvel")

        [record] = self.collector.records()
        body = plain(record["body"])
        received = {str(key): value for key, value in sent.items()} | {
            "most": str(2**64 - 1), "nan": "NaN", "endless": "-Infinity", "bytes": "AP8=",
            "when": "2026-01-31T12:00:00.000005Z"}
        for key, value in received.items():
            self.assertEqual((type(body[key]), body[key]), (type(value), value), key)
        row = service.rows("SELECT * FROM message")[0]
        self.assertEqual(record["timeUnixNano"], f"{row['sent_at']}000")
        self.assertEqual(attributes(record), {
            "log.record.uid": {"stringValue": f"{store}-message-{row['id']}"},
            "quarvel.table": {"stringValue": "message"},
            "quarvel.agent_session": {"intValue": "1"},
            "quarvel.session_id": {"stringValue": str(-2**63)},
            "quarvel.client_name": {"stringValue": row["client_name"]},
            "quarvel.service_name": {"stringValue": row["service_name"]},
            "quarvel.category": {"intValue": "3"}, "quarvel.category_name": {"stringValue": "Playback"},
            "quarvel.type": {"intValue": "4"}, "quarvel.type_name": {"stringValue": "Error"}})
        client.stop_session(-2**63)
        client.wait(started)

    def test_temporary_failures_are_retried_and_rows_arrive_once(self):
        service, client = self.started()
        # A success follows each failure, so that the back-off does not grow.
        answers = [{"status": 429, "headers": {"Retry-After": "2"}}, {"status": 503}, "reset", "hang",
                   {"status": 404}, {"status": 302, "headers": {"Location": "http://127.0.0.1:1/"}},
                   {"status": 200, "body": "<html>Sign in</html>"}, {"status": 200, "body": "x" * 100_000}]
        for number, answer in enumerate(answers):
            self.collector.answer(answer)
            begun = time.monotonic()
            client.message({"n": number}, [5])
            eventually(lambda: len(self.collector.records()) == number + 1, f"the row behind {answer}")
            if number == 0:
                self.assertGreaterEqual(time.monotonic() - begun, 2)
        self.assertEqual([body["n"] for body in self.collector.bodies()], list(range(len(answers))))
        eventually(lambda: len(self.ledger(service)) == len(answers), "the ledger")
        self.assertEqual({outcome for _, _, outcome in self.ledger(service)}, {"acknowledged"})

    def test_refused_rows_are_recorded_and_stay_in_the_store(self):
        service, client = self.started()
        self.collector.answer({"status": 503, "headers": {"Retry-After": "1"}})
        self.collector.tell("poison", "venom")
        for number in range(40):
            client.message({"n": number, "text": "venom" if number == 17 else "fine"}, [5])
        eventually(lambda: len(self.collector.records()) == 39, "the other rows")
        eventually(lambda: sum(line[1] - line[0] + 1 for line in self.ledger(service)) == 40, "the ledger")
        refused = [line for line in self.ledger(service) if line[2] != "acknowledged"]
        self.assertEqual(refused, [(18, 18, 'refused: it answers 400 and says "poisoned"')])
        self.assertEqual(service.count("message"), 40)
        self.collector.answer({"status": 200, "body": json.dumps(
            {"partialSuccess": {"rejectedLogRecords": "1", "errorMessage": "too old"}})})
        requests = len(self.collector.lines)
        client.message({"n": 40}, [5])
        eventually(lambda: self.ledger(service)[-1] == (41, 41, "partly refused: 1 of 1: too old"), "the ledger")
        self.assertEqual(len(self.collector.lines), requests + 1)

    def test_without_consent_no_row_leaves_and_the_service_ends_at_once(self):
        service, client = self.started()
        service.reconfigure("[agent]\n", "[agent]\nexport = false\n")
        service.notify()

        def no_row_leaves():
            before = len(self.collector.lines)
            client.message({"probe": True}, [5])
            time.sleep(0.3)
            return len(self.collector.lines) == before
        eventually(no_row_leaves, "the consent to be read")
        before = len(self.collector.lines)
        client.message({"n": "kept"}, [5])
        time.sleep(1)
        service.end()
        service.start()
        time.sleep(1)
        self.assertEqual(len(self.collector.lines), before)
        service.reconfigure("export = false\n", "")
        service.notify()
        eventually(lambda: {"n": "kept"} in self.collector.bodies(), "the row that waited")

        client = self.client(service, session=5)
        self.collector.answer("hang")
        client.message({"n": "under way"}, [5])
        eventually(lambda: self.collector.lines[-1]["answer"] == "hang", "the request that hangs")
        begun = time.monotonic()
        self.assertEqual(service.end(), 0)
        self.assertLess(time.monotonic() - begun, 5)
        service.start()
        eventually(lambda: {"n": "under way"} in self.collector.bodies(), "the row after a restart")

    def test_erased_rows_never_leave_and_the_ledger_shows_the_others(self):
        service, client = self.started()
        client.message({"n": 1}, [5])
        eventually(lambda: len(self.collector.records()) == 1, "the first row")
        self.collector.answer(*["hang"] * 100)
        client.start_session(6)
        for number in range(50):
            client.message({"n": number, "text": "secret"}, [6])
        eventually(lambda: self.collector.lines[-1]["answer"] == "hang", "a request under way")
        service.wait_for_rows(50, "message WHERE session_id = 6")
        backends = self.shown(service, "exports", "backend")
        self.assertEqual([(backend["backend"], backend["backlog"] > 40) for backend in backends], [("otlp", True)])

        erased = service.ctl("erase", "--session", 6, "--json")
        self.assertEqual((erased.returncode, erased.stderr), (0, ""))
        self.assertEqual(json.loads(erased.stdout), {"rows": 51})
        self.assertEqual(service.count("message WHERE session_id = 6"), 0)
        self.collector.answer()
        client.message({"n": 2}, [5])
        self.assertEqual(service.ctl("exports", "--wait").returncode, 0)
        self.assertEqual(self.collector.bodies(), [{"n": 1}, {"n": 2}])
        ledger = self.shown(service, "exports", "outcome")
        self.assertEqual([line["rows"] for line in ledger if line["outcome"] == "erased: session 6"], [51])
        self.assertEqual(sum(line["rows"] for line in ledger if line["table"] == "message"), 2)
        status = service.status()
        [backend] = status["backends"]
        self.assertEqual((backend["name"], backend["backlog"], backend["error"]), ("otlp", 0, None))
        self.assertEqual(status["counters"]["dropped"]["erased"], 50)
        for wrong in ([], ["--all", "--session", 5], ["--before", "yesterday"]):
            self.assertNotEqual(service.ctl("erase", *wrong).returncode, 0, wrong)

        service.end()
        self.assertEqual(service.ctl("erase", "--all", "--json").returncode, 0)
        self.assertEqual(service.count("message") + service.count("agent_session"), 0)

    def shown(self, service, command, key):
        shown = service.ctl(command, "--json")
        self.assertEqual((shown.returncode, shown.stderr), (0, ""))
        return [entry for entry in map(json.loads, shown.stdout.splitlines()) if key in entry
                and (key != "backend" or "outcome" not in entry)]
