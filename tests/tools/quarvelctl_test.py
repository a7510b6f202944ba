"""quarvelctl as people and programs use it: as a process, against the installed service and a store."""

import json
import os
import pathlib
import pty
import shutil
import sqlite3
import subprocess
import sys
import tempfile
import termios
import time
import tomllib
import unittest

import harness

QUARVELCTL = (pathlib.Path(__file__).resolve().parent.parent / "launch", sys.argv.pop(1))
CREATE, SET_TYPE = "createReportingSession:reply:", "setServiceType:reportingSession:reply:"
START, STOP = "startReportingSessionForID:reply:", "stopReportingSessionForID:reply:"
SEND = "sendMessage:withCategory:andType:forReportingIDs:reply:"
VALID, REPORTERS, KILL = "reporterID:valid:", "getAllReporters:", "killService:"
NOON = 1_769_860_800_000_000  # 2026-01-31T12:00:00Z


def enough(cases):
    """Under valgrind, which takes a second to start, some of the cases: the sanitizers look at all."""
    return cases[::4] if "QUARVEL_VALGRIND" in os.environ else cases


class ToolTest(harness.ServiceTest):
    def setUp(self):
        self.directory = tempfile.TemporaryDirectory(prefix="quarvelctl-")
        self.addCleanup(self.directory.cleanup)
        self.root = pathlib.Path(self.directory.name)
        self.environment = {name: os.environ[name] for name in ("PATH", "QUARVEL_VALGRIND") if name in os.environ}
        self.environment |= {"TZ": "UTC", "QUARVEL_SOCKET": str(self.root / "reporting.sock"),
                             "STATE_DIRECTORY": str(self.root), "CONFIGURATION_DIRECTORY": str(self.root / "etc")}

    def ctl(self, *arguments, stdin=""):
        """Status, standard output's lines, standard error."""
        ran = subprocess.run([*QUARVELCTL, *map(str, arguments)], input=stdin, text=True,
                             capture_output=True, env=self.environment, timeout=60, check=False)
        return ran.returncode, ran.stdout.splitlines(), ran.stderr

    def rows(self, *arguments):
        """The objects that a command prints with --json, one a line."""
        status, lines, error = self.ctl(*arguments, "--json")
        self.assertEqual((status, error), (0, ""))
        return [json.loads(line) for line in lines]

    def fails(self, reason, *arguments):
        """Runs a command that prints nothing and fails with this reason."""
        status, lines, error = self.ctl(*arguments)
        self.assertEqual((status, lines), (1, []), arguments)
        self.assertIn(str(reason), error)

    def new_store(self):
        """The empty store that a service makes; a connection to it."""
        service = self.service("[analytics]\nwanted = []\n")
        service.end()
        return sqlite3.connect(shutil.copy(service.directory / "state/telemetry.db", self.root), isolation_level=None)


class Service(ToolTest):
    def setUp(self):
        super().setUp()
        self.daemon = self.service()
        self.environment["QUARVEL_SOCKET"] = str(self.daemon.socket)

    def run_script(self, *steps):
        """Status, replies, standard error."""
        status, lines, error = self.ctl("run", "-", stdin="".join(json.dumps(step) + "\n" for step in steps))
        return status, [json.loads(line) for line in lines], error

    def test_replies_are_printed_as_they_arrive_and_a_start_does_not_hold_up(self):
        status, replies, error = self.run_script(
            {"call": CREATE, "args": [7]}, {"call": SET_TYPE, "args": [2, 7]}, {"call": START, "args": [7]},
            {"call": VALID, "args": [7]}, {"expect": {"serviceType": 2, "reporterID": 7}}, {"sleep": 0},
            {"call": STOP, "args": [7]}, {"call": REPORTERS, "wait": False})
        self.assertEqual((status, error), (0, ""))
        self.assertEqual([reply["call"] for reply in replies], [CREATE, SET_TYPE, VALID, START, STOP, REPORTERS])
        self.assertEqual(replies[3], {"call": START, "args": [7], "result": True})
        self.assertEqual(replies[5]["result"], [7])
        status, replies, _ = self.run_script({"call": START, "args": [9]})
        self.assertEqual((status, replies), (0, []), "a start that is never answered does not hang the script")

    def test_what_json_lacks_can_be_sent(self):
        payload = {"At": {"$date": "2026-01-31T12:00:00.25Z"}, "Raw": {"$bytes": "AP8="},
                   "Kept": {"$date": 1, "other": 2}, "Numbers": [2**63, -1, 1.5, None]}
        arguments = [payload, 3, 1, None]
        status, replies, _ = self.run_script({"call": SEND, "args": arguments})
        self.assertEqual((status, replies[0]["args"]), (0, arguments))
        [row] = self.daemon.wait_for_rows(1, "message")
        self.assertEqual(json.loads(row["payload"]), payload | {"At": "2026-01-31T12:00:00.250000Z", "Raw": "AP8="})

    def test_an_expectation_that_fails_names_its_line(self):
        status, _, error = self.run_script({"call": REPORTERS}, {"expect": []}, {"call": "unknown"},
                                           {"expect": True})
        self.assertEqual(status, 1)
        self.assertIn("standard input:4: The last reply is {\"domain\":\"quarvel.connection\"", error)

    def test_killing_ends_the_script_in_order(self):
        status, replies, _ = self.run_script({"call": CREATE, "args": [7]}, {"call": START, "args": [7]}, {"call": KILL})
        self.assertEqual(status, 0)
        self.assertEqual({reply["error"]["domain"] for reply in replies[1:]}, {"quarvel.client"})

    def test_nothing_is_played_of_a_file_with_a_fault(self):
        faults = [('{"call": 7}', "keyword name"), ('{"call": "x", "args": {}}', "a list"),
                  ('{"call": "x", "wiat": true}', '"wiat"'), ('{"sleep": -1}', "seconds"),
                  ('{"call": "x", "args": [{"$date": "noon"}]}', "$date"),
                  ('{"call": "x", "args": [{"$bytes": "?"}]}', "$bytes"), ("[]", "A line is"), ("{", ":3: ")]
        for line, reason in faults:
            with self.subTest(line):
                script = self.root / "script.jsonl"
                script.write_text("# A comment, and a call that is right.\n{\"call\": \"x\"}\n" + line + "\n")
                self.fails("script.jsonl:3: ", "run", script)
                self.fails(reason, "run", script)

    def test_reporters_and_validity(self):
        client = self.client(self.daemon)
        for reporter, service_type in ((7, 2), (-8, 4242)):
            client.call(CREATE, reporter)
            client.call(SET_TYPE, service_type, reporter)
        self.assertEqual(self.ctl("reporters")[:2], (0, ["-8", "7"]))
        self.assertEqual(self.ctl("reporters", "--json")[:2], (0, ["[-8,7]"]))
        self.assertEqual(self.ctl("valid", 7)[:2],
                         (0, ["7 is a reporting session of service type 2 (telephony)."]))
        self.assertIn("(without a name)", self.ctl("valid", -8)[1][0])
        status, lines, error = self.ctl("--json", "valid", 9)
        self.assertEqual((status, json.loads(lines[0])["serviceTypeName"]), (1, "unknown"))
        self.assertIn("No client has a reporting session 9.", error)


class Store(ToolTest):
    def setUp(self):
        super().setUp()
        self.store = self.new_store()
        self.addCleanup(self.store.close)
        info = json.dumps({"HostApplicationDisplayID": "org.example.dialer"})
        for number, flushed in ((7, NOON + 1_500_000), (8, None)):
            self.store.execute("INSERT INTO agent_session VALUES(NULL,?,19,2.0,1,'','tarnwick.quarvel',"
                               "'telephony_session',?,?,?)", (number, info, NOON, flushed))
        self.add_message(1, 7, 9, 0, {"Glitches": 3})
        self.add_message(1, 7, 65535, 65535, {"Note": "é" * 200})
        self.add_message(None, -1, 11, 4, {"Volume": 0.5})

    def add_message(self, agent_session, session, category, kind, payload):
        self.store.execute(
            "INSERT INTO message VALUES(NULL,?,?,'tarnwick.quarvel','telephony_session',?,?,?,?)",
            (agent_session, session, category, kind, json.dumps(payload, ensure_ascii=False), NOON + 1_000))

    def test_sessions(self):
        _, lines, _ = self.ctl("sessions")
        self.assertEqual([line.split() for line in lines[1:]], [
            ["7", "telephony", "01-31", "12:00:00.000", "1.500", "s", "2", "org.example.dialer"],
            ["8", "telephony", "01-31", "12:00:00.000", "not", "ended", "0", "org.example.dialer"]])
        ended, open_still = self.rows("sessions")
        self.assertEqual(ended["flushedAt"], "2026-01-31T12:00:01.500000Z")
        self.assertEqual(open_still, {
            "id": 2, "session": 8, "clientType": 19, "clientVersion": 2.0, "batchEvent": True,
            "hierarchyToken": "", "client": "tarnwick.quarvel", "service": "telephony_session",
            "openedAt": "2026-01-31T12:00:00.000000Z", "flushedAt": None, "messages": 0,
            "userInfo": {"HostApplicationDisplayID": "org.example.dialer"}})

    def test_messages(self):
        _, lines, _ = self.ctl("messages", "--session", 7)
        self.assertEqual(len(lines), 3)
        self.assertRegex(lines[1], r"12:00:00\.001 +7 +telephony +Tallixing +Generic +\{\"Glitches\": 3\}$")
        self.assertRegex(lines[2], r"Undefined +Unknown ")
        self.assertRegex(self.ctl("messages", "--last", 1)[1][1], r" single .* Volume +Error ")
        self.assertEqual(self.rows("messages", "--session", -1)[0], {
            "id": 3, "agentSession": None, "session": -1, "service": "telephony_session", "category": 11,
            "categoryName": "Volume", "type": 4, "typeName": "Error",
            "sentAt": "2026-01-31T12:00:00.001000Z", "payload": {"Volume": 0.5}})

    def add_event(self, name, payload, seconds):
        self.store.execute("INSERT INTO analytics_event VALUES(NULL,?,?,?)",
                           (name, json.dumps(payload), NOON + round(seconds * 1e6)))

    def test_events(self):
        for number in range(3):
            self.add_event(f"event{number}", {"Number": number}, number)
        self.store.execute("INSERT INTO power_event VALUES(NULL,12,'power','{\"On\": true}',?)", (NOON,))
        _, lines, _ = self.ctl("events", "--last", 2)
        self.assertEqual([line.split()[2:] for line in lines],
                         [["PAYLOAD"], ["event1", '{"Number":', "1}"], ["event2", '{"Number":', "2}"]])
        self.assertEqual(self.rows("events", "--last", 1)[0], {
            "id": 3, "name": "event2", "recordedAt": "2026-01-31T12:00:02.000000Z", "payload": {"Number": 2}})
        self.assertRegex(self.ctl("power")[1][1], r"12:00:00\.000 +12 +power +\{\"On\": true\}$")
        self.assertEqual(self.rows("power")[0]["domain"], 12)

    def test_a_summary_is_of_the_latest_run(self):
        self.store.execute("INSERT INTO agent_session SELECT 9, session_id, client_type, client_version,"
                           " batch_event, hierarchy_token, client_name, service_name, user_info, ?, ?"
                           " FROM agent_session WHERE id = 1", (NOON + 2_000_000, NOON + 5_500_000))
        for _ in range(2):
            self.add_message(9, 7, 7, 1, {"Route": "Earpiece"})
        self.add_message(9, 7, 9, 0, {"Codec_Underruns": 4})
        self.add_message(9, 7, 65535, 65535, {
            "device_orientation": "portrait,landscapeLeft", "device_orientation_time": "0.0,1.25",
            "ui_orientation": "portrait", "ui_orientation_time": "0.5"})
        [summary] = self.rows("summary", 7)
        self.assertEqual((summary["earlierRuns"], summary["seconds"], summary["flushed"]), (1, 3.5, True))
        self.assertEqual([(row["categoryName"], row["typeName"], row["count"]) for row in summary["messages"]],
                         [("RouteChange", "Start", 2), ("Tallixing", "Generic", 1), ("Undefined", "Unknown", 1)])
        self.assertEqual(summary["driverStatistics"], {"Codec_Underruns": 4})
        self.assertEqual([tuple(change.values()) for change in summary["orientation"]],
                         [("device", "portrait", 0.0), ("device", "landscapeLeft", 1.25), ("ui", "portrait", 0.5)])
        text = "\n".join(self.ctl("summary", 7)[1])
        for shown in ("Session +7, its run 2", "Application +org.example.dialer", "Duration +3.500 s",
                      "2 +RouteChange +Start", "Codec_Underruns +4", "1.25 s +device +landscapeLeft"):
            self.assertRegex(text, shown)
        self.assertRegex("\n".join(self.ctl("summary", 8)[1]), "Duration +not ended\nFlushed +no")
        self.fails("no run of a session 99", "summary", 99)

    def test_a_client_s_uptime_is_told_only_when_it_can_be_no_other_s(self):
        event = "tarnwick.quarvel.zqreportingclientuptime"
        for name, process, seconds, at, told in (
                (event, "left before the end", 9.0, 1, False), (event, "came after the start", 1.0, 2, False),
                (event, "unknown", -1, 2, False), ("another", "another", 9.0, 2, False),
                (event, "dialer", 2.5, 2, True), (event, "player", 60.0, 3, False)):
            uptime = {"processName": process, "seconds": seconds}
            self.add_event(name, uptime, at)
            self.assertEqual(self.rows("summary", 7)[0].get("clientUptime"), uptime if told else None)

    def test_since_and_last_choose_rows(self):
        now = time.time_ns() // 1000
        for minutes in (30, 90):
            self.store.execute(
                "INSERT INTO message VALUES(NULL,1,7,'','telephony_session',1,1,'{}',?)", (now - minutes * 60_000_000,))
        for since, numbers in enough((("1h", [4]), ("1h45m", [4, 5]), ("100m", [4, 5]), ("1s", []),
                                      ("2026-01-31T13:00:00.001+01:00", [1, 2, 3, 4, 5]),
                                      ("2026-01-31T12:00:00.0011Z", [4, 5]))):
            with self.subTest(since):
                self.assertEqual([row["id"] for row in self.rows("messages", "--since", since)], numbers)
        self.assertEqual(len(self.ctl("sessions", "--since", "2026-01-31T12:00:00Z")[1]), 3)
        self.assertEqual(len(self.ctl("sessions", "--since", "1h")[1]), 1)
        self.assertEqual([row["session"] for row in self.rows("sessions", "--last", 1)], [8])
        self.add_event("now", {}, now / 1e6 - NOON / 1e6)
        self.assertEqual(len(self.ctl("events", "--since", "10m")[1]), 2)
        for wrong in enough(("", "5", "m", "1h1h", "10m2h", "-1h", "1.5h", "9999999999w", "yesterday", "2026-01-31")):
            status, _, error = self.ctl("messages", f"--since={wrong}")
            self.assertEqual((status, "--since" in error), (2, True), wrong)

    def on_terminal(self, columns, *arguments, **variables):
        """The lines that a terminal of so many columns gets."""
        master, slave = pty.openpty()
        termios.tcsetwinsize(slave, (24, columns))
        subprocess.run([*QUARVELCTL, *arguments], stdout=slave, env=dict(self.environment, **variables),
                       timeout=60, check=True)
        os.close(slave)
        lines = os.read(master, 65536).decode().splitlines()
        os.close(master)
        return lines

    def test_a_terminal_gets_lines_that_fit_and_colour(self):
        lines = self.on_terminal(80, "messages")
        self.assertTrue(lines[0].startswith("\x1b[1mSENT"))
        self.assertEqual([len(line) for line in lines[1:] if "é" in line], [80])
        # An ideograph takes two columns, a combining accent none.
        for note in ("音" * 100, "e\u0301" * 100, "\u202ebackwards\x7f\x9b31m"):
            self.add_message(1, 7, 1, 1, {"Note": note})
        self.add_event("tarnwick.quarvel." + "A" * 100, {"Payload": "B" * 100}, 1)
        for columns in enough((40, 60, 81, 200)):
            for line in self.on_terminal(columns, "messages", NO_COLOR="1")[1:] + \
                    self.on_terminal(columns, "events", NO_COLOR="1"):
                width = sum(2 if character == "音" else 0 if character == "\u0301" else 1 for character in line)
                self.assertLessEqual(width, columns, line)
                self.assertNotRegex(line, "[\x1b\u202e\x7f\x9b]")
        events = self.on_terminal(80, "events", NO_COLOR="1")[-1]
        self.assertRegex(events, r"A…  \{.*B…$", "neither text takes all the room")
        self.assertTrue(self.on_terminal(80, "events", NO_COLOR="")[0].startswith("\x1b"))

    def test_following_prints_what_is_stored_later(self):
        with subprocess.Popen([*QUARVELCTL, "messages", "--last", "1", "--follow", "--json"], text=True,
                              stdout=subprocess.PIPE, env=self.environment) as following:
            try:
                self.assertEqual(json.loads(following.stdout.readline())["id"], 3)
                for number in (4, 5):
                    self.add_message(2, 8, 1, 1, {"Number": number})
                    self.assertEqual(json.loads(following.stdout.readline())["payload"], {"Number": number})
            finally:
                following.terminate()


class Preferences(ToolTest):
    def setUp(self):
        super().setUp()
        self.file = self.root / "etc" / "preferences" / "tarnwick.quarvel.toml"

    def test_values_are_written_read_and_deleted(self):
        for text, value in enough((
                ("true", True), ("-5", -5), ("1.5", 1.5), ("a \"b\" \\ é", "a \"b\" \\ é"), ("", ""),
                ("two\nlines", "two\nlines"), ("1.5.2", "1.5.2"), ("nan", "nan"), ("007", "007"), ("-0.5", -0.5),
                (str(2**63 - 1), 2**63 - 1), (str(2**63), str(2**63)))):
            with self.subTest(text):
                status, lines, error = self.ctl("defaults", "write", "a key", text)
                self.assertEqual((status, error), (0, ""))
                self.assertIn("quarvelctl notify", lines[0])
                self.assertEqual(tomllib.loads(self.file.read_text()), {"a key": value})
                self.assertEqual(self.rows("defaults", "read", "a key"), [value])
        self.assertIn("UTF-8", self.ctl("defaults", "write", "a key", "\udcff")[2])
        self.ctl("defaults", "write", "a key", "7", "--string")
        self.assertEqual(self.ctl("defaults", "read", "--json")[1], ['{"a key":"7"}'])
        self.assertEqual(self.ctl("defaults", "delete", "a key")[0], 0)
        for command in ("read", "delete"):
            self.fails(f"is not set in {self.file}", "defaults", command, "a key")
        self.ctl("defaults", "write", "key", "text", "--domain", "org.example")
        self.assertEqual(self.file.with_name("org.example.toml").read_text().split(), ["key", "=", '"text"'])
        self.assertEqual(self.ctl("defaults", "--domain", "org.example", "read", "key")[1], ["text"])

    def test_a_change_leaves_the_rest_of_the_file_alone(self):
        self.file.parent.mkdir(parents=True)
        self.file.write_text('# Ours.\ndevice_name = """\nlong\none"""\n\n# Why.\n"odd key" = 1\nlast = 2  # kept')
        self.file.chmod(0o640)
        self.ctl("defaults", "write", "device_name", "short")
        self.ctl("defaults", "delete", "odd key")
        self.ctl("defaults", "write", "new.key", "true")
        self.assertEqual(self.file.read_text().replace("'", '"'),
                         '# Ours.\ndevice_name = "short"\n\n# Why.\nlast = 2  # kept\n"new.key" = true\n')
        self.assertEqual((self.file.stat().st_mode & 0o777, len(list(self.file.parent.iterdir()))), (0o640, 1))

    def test_what_the_service_could_not_understand_is_not_touched(self):
        self.file.parent.mkdir(parents=True)
        for line in enough(("key = ", "key = [1]", "[table]", "a.b = 1")):
            with self.subTest(line):
                content = "first = 1\n" + line + "\n"
                self.file.write_text(content)
                for arguments in (["read"], ["write", "key", "1"], ["delete", "first"]):
                    self.fails(f"{self.file}:2: ", "defaults", *arguments)
                    self.assertEqual(self.file.read_text(), content)
        self.file.unlink()
        self.file.mkdir()
        self.fails(f"{self.file} cannot be read", "defaults", "write", "key", "1")

    def test_notifications(self):
        self.fails("The service is not running", "notify")
        notify = self.root / "notify"
        notify.mkdir()
        self.assertEqual(self.ctl("notify", "org.example.note")[0], 0)
        self.assertEqual(self.ctl("defaults", "write", "key", "1", "--notify")[0], 0)
        self.assertEqual({file.name for file in notify.iterdir()},
                         {"org.example.note", "tarnwick.quarvel.reporting"})
        os.utime(notify / "org.example.note", (1, 1))
        self.ctl("notify", "org.example.note")
        self.assertGreater((notify / "org.example.note").stat().st_mtime, 1)


class Refusal(ToolTest):
    def test_what_is_not_there_says_what_to_do(self):
        for arguments, reason in ((["reporters"], "The service is not running"), (["sessions"], "--store"),
                                  (["run", "none.jsonl"], "none.jsonl cannot be read")):
            self.fails(reason, *arguments)

    def test_what_is_no_store_of_this_version_is_left_alone(self):
        for statement, reason in (("PRAGMA user_version = 2", "is of version 2"),
                                  ("PRAGMA application_id = 7", "is not a telemetry store")):
            store = self.new_store()
            store.execute(statement)
            store.close()
            self.fails(reason, "messages")
        (self.root / "text.db").write_text("Not a database, but long enough to be taken for one. " * 20)
        self.fails("cannot be read", "messages", "--store", self.root / "text.db")

    def test_wrong_usage_is_told_from_failure(self):
        for arguments in enough((
                [], ["nonsense"], ["valid"], ["valid", "seven"], ["messages", "--last", "-1"],
                ["events", "--last", "0"], ["summary"], ["defaults"], ["defaults", "write", "key"],
                ["notify", "../x"], ["notify", ""], ["defaults", "read", "--domain", "../x"])):
            self.assertEqual(self.ctl(*arguments)[0], 2, arguments)
        self.assertEqual(self.ctl("--help")[0], 0)


if __name__ == "__main__":
    unittest.main()
