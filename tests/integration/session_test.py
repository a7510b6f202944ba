"""A client's sessions, from its socket to the store, with the installed service."""

import collections
import json
import pathlib
import subprocess
import time

from harness import PATIENCE, QUARVELD, ServiceTest, eventually


class Sessions(ServiceTest):
    def test_every_message_of_a_session_is_in_the_store(self):
        service = self.service()
        client = self.client(service)
        started = client.start_session(77, 2, {"HostApplicationDisplayID": "org.example.phone"})
        for number in range(300):
            client.message({"call number": number, "route": "Receiver"}, [77], 0x40000007, 1)
        self.assertNotIn(started, client.replies, "a start is answered at the stop")
        client.stop_session(77)
        self.assertIs(client.wait(started), True)
        eventually(lambda: service.count("agent_session WHERE flushed_at IS NOT NULL"), "a flush")
        session = service.rows("SELECT * FROM agent_session")[0]
        self.assertEqual(session["session_id"], 77)
        self.assertEqual((session["client_type"], session["client_version"], session["batch_event"]), (19, 2.0, 1))
        self.assertRegex(session["hierarchy_token"], "^[0-9a-f]{32}$")
        self.assertEqual((session["client_name"], session["service_name"]), ("tarnwick.quarvel", "telephony_session"))
        self.assertEqual(json.loads(session["user_info"]), {
            "ClientName": "tarnwick.quarvel", "ServiceName": "telephony_session",
            "HostApplicationDisplayID": "org.example.phone"})
        *messages, last = service.rows("SELECT * FROM message WHERE agent_session = ? ORDER BY id", session["id"])
        self.assertEqual(len(messages), 300)
        for number, message in enumerate(messages):
            self.assertEqual(json.loads(message["payload"]), {"call_number": number, "route": "Receiver"})
            self.assertEqual((message["category"], message["type"], message["session_id"], message["client_name"]),
                             (7, 1, 77, "tarnwick.quarvel"))
        summary = json.loads(last["payload"])
        self.assertEqual((last["category"], last["type"]), (0xFFFF, 0xFFFF))
        self.assertEqual(summary["ZQ_Session_Summary_Event"], "2")
        self.assertEqual(json.loads(summary["Routing_RouteChange_Start_300"])["call_number"], 299)
        self.assertEqual(service.count("analytics_event WHERE name LIKE '%.Routing_RouteChange.Start'"), 300)
        client.close()
        uptime = service.wait_for_rows(
            1, "analytics_event WHERE name LIKE '%uptime' AND payload LIKE '%python%'")[0]
        self.assertGreater(json.loads(uptime["payload"])["seconds"], 0)

    def test_messages_outside_a_session_go_one_by_one(self):
        service = self.service()
        client = self.client(service)
        client.message({"EngineOnTime": 1.5, "zqreporting_timestamp": 7}, None)
        client.call("createReportingSession:reply:", 5)
        client.call("setServiceType:reportingSession:reply:", 3, 5)
        client.message({"EngineOnTime": 2.5, "zqreporting_timestamp": 8}, [5])
        rows = service.wait_for_rows(2, "message")
        self.assertEqual({(row["agent_session"], row["session_id"], row["service_name"]) for row in rows},
                         {(None, -1, "standalone"), (None, -1, "haptics")})
        power = service.wait_for_rows(1, "power_event")
        self.assertEqual([(row["domain"], row["name"], json.loads(row["payload"])) for row in power],
                         [(28, "Fennor_Haptics",
                           {"EngineOnDuration": 2.5, "ApplicationName": "Unknown", "TimestampEnd": 8})])

    def test_a_thousand_sessions_wait_for_backends_beside_a_served_client(self):
        service = self.service("[agent]\nbackends = []\n")
        waiting, other = self.client(service), self.client(service)
        other.call("createReportingSession:reply:", 2000)
        failed = lambda: service.log().count("failed to find backend")

        def start(reporter):
            waiting.send("createReportingSession:reply:", reporter)
            waiting.send("startReportingSessionForID:reply:", reporter)

        to_start = collections.deque(range(1, 1001))
        calls = 0
        while failed() == 0:
            if to_start:
                start(to_start.popleft())
            self.assertEqual(other.call("reporterID:valid:", 2000)["reporterID"], 2000)
            calls += 1
        self.assertGreater(calls, 20, "in nine seconds, calls that take far less than half a second each")
        for reporter in to_start:  # on a slow machine the first wait ends before all are started
            start(reporter)
        eventually(lambda: failed() == 1000, "all sessions gave up, side by side and not one by one")


class Idle(ServiceTest):
    def test_an_idle_service_never_wakes_up(self):
        service = self.service()
        for number in range(100):
            self.client(service, session=number + 1)

        def switches():
            tasks = pathlib.Path(f"/proc/{service.process.pid}/task").iterdir()
            lines = [line for task in tasks for line in (task / "status").read_text().splitlines()]
            return sum(int(line.split()[1]) for line in lines if line.startswith("voluntary"))

        def stays_asleep():
            try:
                before = switches()
                time.sleep(2)
                return switches() == before
            except FileNotFoundError:
                return False  # a thread has just ended

        eventually(stays_asleep, "two seconds without a wake-up")


class Ends(ServiceTest):
    def test_an_orderly_end_loses_nothing(self):
        service = self.service()
        client = self.client(service)
        client.call("createReportingSession:reply:", 4)
        client.call("setServiceType:reportingSession:reply:", 4, 4)
        for number in range(50):
            client.message({"alarm": number}, [4])
        client.start_session(6)
        client.message({"in": "session"}, [6])
        self.assertEqual(service.end(), 0)
        self.assertEqual(service.count("message WHERE service_name = 'alarms'"), 50,
                         "delayed messages are sent before the end")
        self.assertEqual(service.count("message WHERE session_id = 6"), 2, "and the session's summary")
        self.assertEqual(service.count("agent_session WHERE flushed_at IS NOT NULL"), 1)
        self.assertFalse(service.socket.exists())

        service.start()
        self.assertEqual(service.ctl("kill").returncode, 0)
        self.assertEqual(service.process.wait(PATIENCE), 2)
        self.assertIn("DESTROYING SERVICE", service.log())

    def test_a_failed_start_has_one_error_line(self):
        second, wrong, unwritable = self.prepared(), self.prepared('[limits]\ndepth = "deep"\n'), self.prepared()
        running, newer = self.service(), self.service()
        second.environment["QUARVEL_SOCKET"] = str(running.socket)
        newer.end()
        newer.rows("PRAGMA user_version = 99", mode="rw")
        (unwritable.directory / "file").touch()
        unwritable.environment["STATE_DIRECTORY"] = str(unwritable.directory / "file/state")
        for service, words in ((second, [str(running.socket)]), (newer, ["telemetry.db", "99"]),
                               (wrong, ["quarvel.toml", "depth"]), (unwritable, ["file/state"])):
            ended = subprocess.run(QUARVELD, env=service.environment, capture_output=True, text=True, timeout=PATIENCE)
            self.assertEqual(ended.returncode, 1, ended.stderr)
            errors = [line for line in ended.stderr.splitlines() if " error " in line or "quarveld:" in line]
            self.assertEqual(len(errors), 1, ended.stderr)
            for word in words:
                self.assertIn(word, errors[0])
        self.client(running).call("getAllReporters:")
