"""The packages on a machine of their own under systemd: installed, started by a client, sandboxed, reloaded,
killed, stopped, removed."""

import json
import os
import pathlib
import time
import unittest

from harness import PATIENCE, eventually
from machine import Machine

PACKAGES = sorted((pathlib.Path(os.environ["QUARVEL_BUILD"]) / "packages").glob("*.deb"))
UNIT = "quarvel.service"
HISTORIES = "/private/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/Audio/Reporting"
CONFIGURATION = """
    [device]
    InternalBuild = true
    [agent]
    backends = ["store", "otlp", "nats"]
    [agent.otlp]
    endpoint = "http://localhost:4318"
    [agent.nats]
    create_stream = true
    replicas = 1
    [orientation]
    source = "iio"
    [tallix]
    root = "/run/audio-counters"
    [[tallix.channel]]
    group = "Speaker"
    name = "ContextSwitches"
    file = "/proc/stat"
    pattern = '^ctxt ([0-9]+)'
    """
# A sensor proxy, whose name the bus policy allows.
SENSOR = """
    [Service]
    Type=dbus
    BusName=net.hadess.SensorProxy
    ExecStart=/usr/bin/python3 -m dbusmock --system --template iio-sensors-proxy -p '{"has_accelerometer": true}'
    """
COLLECTOR = """
    import http.server
    class Collector(http.server.BaseHTTPRequestHandler):
        def do_POST(self):
            self.rfile.read(int(self.headers["Content-Length"]))
            self.send_response(200)
            self.send_header("Content-Type", "application/json")
            self.send_header("Content-Length", "2")
            self.end_headers()
            self.wfile.write(b"{}")
    http.server.ThreadingHTTPServer(("localhost", 4318), Collector).serve_forever()
    """
ENGINES = {"collector": "/usr/bin/python3 /run/collector.py", "nats": "/usr/sbin/nats-server -js -sd /run/nats"}
BUS_POLICY = """
    <busconfig><policy context="default">
      <allow own="net.hadess.SensorProxy"/><allow send_destination="net.hadess.SensorProxy"/>
    </policy></busconfig>
    """


class InstalledMachine(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.machine = Machine()
        cls.addClassCleanup(cls.machine.close)
        cls.machine.must("apt-get", "install", "--yes", *PACKAGES)
        # A user of the group audio, and one of no group.
        cls.machine.must("useradd", "--groups", "audio", "player")
        cls.machine.must("useradd", "stranger")

    def ctl(self, *arguments, user="player"):
        return self.machine.run("setpriv", "--reuid", user, "--regid", user, "--init-groups",
                                "--reset-env", "timeout", PATIENCE, "quarvelctl", *arguments)

    def call(self, *arguments):
        done = self.ctl(*arguments)
        self.assertEqual(done.returncode, 0, done.stderr)
        return done.stdout

    def eventually(self, condition, what):
        try:
            eventually(condition, what, 0.05)
        except AssertionError as failure:
            log = "\n".join(line["MESSAGE"] for line in self.machine.journal(UNIT))
            raise AssertionError(f"{failure}\n{log}") from None

    def await_state(self, state):
        self.eventually(lambda: self.machine.property(UNIT, "ActiveState") == state, state)

    def rows(self, table):
        return [json.loads(line) for line in self.machine.must("quarvelctl", "--json", table).splitlines()]


class OnDemand(InstalledMachine):
    def test_systemd_understands_every_line_and_finds_every_page(self):
        self.machine.must("systemd-analyze", "verify", "--recursive-errors=one", "quarvel.socket", UNIT)
        for page in ("quarvelctl.1", "quarveld.8", "quarvel.toml.5", "quarvel.3"):
            self.machine.must("man", "--where", *reversed(page.rsplit(".", 1)))

    def test_a_client_starts_it_and_starts_it_again_after_a_kill(self):
        self.assertEqual(self.machine.property("quarvel.socket", "ActiveState"), "active")
        self.assertEqual(self.machine.property(UNIT, "ActiveState"), "inactive", "no client has connected")
        refused = self.ctl("reporters", user="stranger")
        self.assertEqual(refused.returncode, 1)
        self.assertIn('"audio"', refused.stderr)

        self.call("run", "/usr/share/doc/quarvel/examples/phone-call.jsonl")
        for _ in range(10):  # more than systemd lets a service start by default
            self.await_state("active")
            self.assertEqual(self.machine.must("stat", "-c", "%U %G %a", "/run/quarvel/reporting.sock"),
                             "quarvel audio 660\n")
            self.call("kill")
            self.await_state("inactive")  # status 2 is no failure
            self.call("reporters")

    def test_reloading_reads_the_preferences(self):
        self.machine.must("quarvelctl", "defaults", "write", "disable_reporting", "true")
        self.call("reporters")
        self.machine.must("systemctl", "reload", UNIT)
        script = '{"call": "sendMessage:withCategory:andType:forReportingIDs:reply:", "args": [{}, 3, 1, []]}'

        def refused():
            return "tarnwick.audio.reporting" in self.machine.must("quarvelctl", "run", "-", input=script)

        self.eventually(refused, "reporting is off")
        self.machine.must("quarvelctl", "defaults", "delete", "disable_reporting")
        self.machine.must("systemctl", "reload", UNIT)
        self.eventually(lambda: not refused(), "reporting is on")

        self.machine.must("systemctl", "stop", UNIT)
        self.machine.must("quarvelctl", "defaults", "write", "disable_reporting", "true")
        self.eventually(refused, "preferences set while it was stopped hold from the start")
        self.machine.must("quarvelctl", "defaults", "delete", "disable_reporting", "--notify")

    def test_a_service_that_hangs_is_restarted(self):
        self.machine.write(f"/run/systemd/system/{UNIT}.d/soon.conf", "[Service]\nWatchdogSec=3\n")
        self.machine.must("systemctl", "daemon-reload")
        self.machine.must("systemctl", "restart", UNIT)
        first = self.machine.property(UNIT, "MainPID")
        time.sleep(5)
        self.assertEqual(self.machine.property(UNIT, "MainPID"), first, "its pings arrive")
        self.machine.must("systemctl", "kill", "--kill-whom=main", "--signal=STOP", UNIT)
        self.eventually(lambda: self.machine.property(UNIT, "MainPID") not in (first, "0"), "another one")
        self.call("reporters")
        self.machine.must("rm", "-r", f"/run/systemd/system/{UNIT}.d")
        self.machine.must("systemctl", "daemon-reload")


class Sandbox(InstalledMachine):
    def test_everything_works_in_the_sandbox(self):
        machine = self.machine
        machine.write("/etc/dbus-1/system.d/sensor.conf", BUS_POLICY)
        machine.write("/run/systemd/system/sensor.service", SENSOR)
        machine.write("/run/collector.py", COLLECTOR)
        for name, command in ENGINES.items():
            machine.write(f"/run/systemd/system/{name}.service", f"[Service]\nExecStart={command}\n")
        machine.must("systemctl", "daemon-reload")
        machine.must("systemctl", "start", "sensor.service", *(f"{name}.service" for name in ENGINES))
        machine.write("/run/audio-counters/Haptics/Stats/Taps", "100\n")
        machine.write("/etc/quarvel/quarvel.toml", CONFIGURATION)
        machine.must("systemctl", "restart", UNIT)
        script = "/run/script.jsonl"
        machine.write(script, """
            {"call": "createReportingSession:reply:", "args": [7]}
            {"call": "setServiceType:reportingSession:reply:", "args": [2, 7]}
            {"call": "startReportingSessionForID:reply:", "args": [7]}
            {"call": "reporterID:valid:", "args": [7]}
            {"sleep": 1}
            {"call": "sendMessage:withCategory:andType:forReportingIDs:reply:", "args": [{"a": 1}, 3, 1, [7]]}
            {"sleep": 1}
            {"call": "stopReportingSessionForID:reply:", "args": [7]}
            """)
        machine.must("sh", "-c", "setpriv --reuid player --regid player --init-groups "
                     f"quarvelctl run {script} & sleep 1; echo 130 > /run/audio-counters/Haptics/Stats/Taps; "
                     "gdbus call --system -d net.hadess.SensorProxy -o /net/hadess/SensorProxy "
                     "-m org.freedesktop.DBus.Mock.SetInternalProperty net.hadess.SensorProxy "
                     "AccelerometerOrientation \"<'left-up'>\"; wait")
        messages = self.rows("messages")
        statistics = [message["payload"] for message in messages if message["categoryName"] == "Tallixing"]
        self.assertEqual([entry["Haptics_Stats_Taps"] for entry in statistics], [30], "driver files")
        self.assertGreater(statistics[0]["Speaker_ContextSwitches"], 0, "counters in /proc")
        summary = [message["payload"] for message in messages if message["category"] == 65535][-1]
        self.assertIn("landscapeRight", summary["device_orientation"], "the sensor on the system bus")
        uptimes = [event["payload"]["processName"] for event in self.rows("events") if "uptime" in event["name"]]
        self.assertEqual(set(uptimes), {"quarvelctl"}, "names of clients' processes")
        [history] = machine.must("find", HISTORIES, "-name", "*.json", "-newer", script).split()
        self.assertEqual(machine.must("stat", "-c", "%U", history), "quarvel\n", "session histories")

        def exported():
            status = json.loads(machine.run("quarvelctl", "--json", "status").stdout)
            backends = {backend["name"]: backend for backend in status["backends"]}
            self.assertEqual(set(backends), {"otlp", "nats"})
            return all(backend["last_acknowledgement"] and not backend["backlog"] for backend in backends.values())

        self.eventually(exported, "both backends have every row")
        self.assertIn("healthy", machine.must("quarvelctl", "status").lower())

        process = machine.property(UNIT, "MainPID")
        stats = machine.must("sh", "-c", f"cat /proc/{process}/task/*/stat").splitlines()
        self.assertIn("5", {stat.rpartition(")")[2].split()[16] for stat in stats}, "queues have their urgency")
        [accepted] = [line for line in machine.journal(UNIT) if "newConnection:" in line["MESSAGE"]]
        self.assertEqual((accepted["QUARVEL_SCOPE"], accepted["CODE_FILE"], accepted["PRIORITY"]),
                         ("tarnwick.quarvel[zqrs]", "ZQReportingServiceDelegate.cc", "5"))
        # The engines may have started later than the service.
        errors = [line["MESSAGE"] for line in machine.journal(UNIT)
                  if line["PRIORITY"] < "4" and "takes no rows" not in line["MESSAGE"]]
        self.assertEqual(errors, [])

    def test_its_group_may_read_the_store_while_it_runs_and_after(self):
        self.machine.must("useradd", "--groups", "quarvel", "reader")
        self.call("run", "/usr/share/doc/quarvel/examples/haptics.jsonl")
        for _ in range(2):
            read = self.ctl("sessions", user="reader")
            self.assertIn("333", read.stdout, read.stderr)
            self.assertIn("group", self.ctl("sessions", user="stranger").stderr)
            self.machine.must("systemctl", "stop", UNIT)


class Removal(InstalledMachine):
    def test_removing_stops_it_and_purging_leaves_nothing_but_the_user(self):
        self.call("run", "/usr/share/doc/quarvel/examples/haptics.jsonl")
        self.machine.must("quarvelctl", "defaults", "write", "device_name", "Kitchen")
        self.machine.must("dpkg", "--remove", "quarvel")
        self.assertNotEqual(self.machine.run("pidof", "quarveld").returncode, 0)
        self.machine.must("test", "-e", "/var/lib/quarvel/telemetry.db", "-a", "-e", "/etc/quarvel/quarvel.toml")
        self.machine.must("apt-get", "install", "--yes", "--reinstall", *PACKAGES)
        self.assertIn("333", self.machine.must("quarvelctl", "sessions"), "the store is kept")
        self.call("reporters")
        self.machine.must("dpkg", "--purge", "quarvel")
        left = self.machine.run("sh", "-c", "ls -d /var/lib/quarvel /etc/quarvel /run/quarvel/reporting.sock "
                                "/etc/systemd/system/sockets.target.wants/quarvel.socket")
        self.assertEqual(left.stdout, "")
