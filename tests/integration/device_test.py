"""The installed service with driver counters, orientation, preferences and device properties."""

import contextlib
import json
import os
import pathlib
import re
import subprocess

from harness import PATIENCE, CallError, ServiceTest, eventually

HISTORY = "diagnostics/private/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/Audio/Reporting"


class Drivers(ServiceTest):
    def test_a_session_reports_the_rise_of_counters(self):
        service = self.prepared()
        tree = service.directory / "tallix"

        def count(**counters):
            (service.directory / "irq").write_text(f"           CPU0 CPU1\n 9:  {counters.pop('irq')} 2  audio\n")
            for channel, value in counters.items():
                path = tree / channel.replace("_", "/")
                path.parent.mkdir(parents=True, exist_ok=True)
                path.write_text(f"{value}\n")

        count(irq=100, Speaker_underruns=5, Board_MCA_clips=10, Haptics_Stats_taps=3, Unrelated_other=1)
        (service.directory / "etc/quarvel.toml").write_text(
            f'[tallix]\nroot = "{tree}"\n[[tallix.channel]]\ngroup = "VorrenMXDrv"\nname = "interrupts"\n'
            f'file = "{service.directory}/irq"\npattern = "9: +([0-9]+).*audio"\n')
        client = self.client(service.start(), session=1)
        count(irq=142, Speaker_underruns=12, Board_MCA_clips=9, Unrelated_other=99)
        client.stop_session(1)
        rows = service.wait_for_rows(1, "message WHERE category = 9")
        self.assertEqual(json.loads(rows[0]["payload"]),
                         {"VorrenMXDrv_interrupts": 42, "Speaker_underruns": 7})
        client.start_session(1)
        (tree / "Speaker/underruns").unlink()
        count(irq=142, Haptics_Stats_taps=4)
        client.stop_session(1)
        rows = service.wait_for_rows(2, "message WHERE category = 9")
        self.assertEqual(json.loads(rows[1]["payload"]), {"Haptics_Stats_taps": 1},
                         "a missing channel fails its own group and no other")
        self.assertIn("TallixCreateSamples error", service.log())

    def test_the_documented_example_finds_its_counter(self):
        document = (pathlib.Path(__file__).parents[2] / "docs/sources.md").read_text()
        [example] = re.findall("```toml\n([^`]*/proc/interrupts[^`]*)```", document)
        service = self.service(example)
        client = self.client(service, session=1)
        client.stop_session(1)
        self.assertIn("subscribed to group group Speaker-(null)", service.log())
        self.assertNotIn("couldn't find any channels for driver group Speaker", service.log())
        self.assertNotIn("SpuriousInterrupts", service.log(), "a counter that cannot be read is logged")


class Preferences(ServiceTest):
    def verbose_scopes(self, service, client):
        """The scopes of the verbose lines of two broadcasts, complete once the second one's line is there."""
        before = len(service.log())
        client.message({}, None)
        client.message({}, None)
        eventually(lambda: service.log()[before:].count("active reporting sessions") == 2, "the second broadcast")
        return set(re.findall(r" debug tarnwick\.quarvel\[(\w+)\]", service.log()[before:]))

    def test_reporting_and_verbose_lines_are_switched_off_and_on(self):
        service = self.service()
        client = self.client(service, session=1)
        service.wait_for_rows(1, "agent_session")

        def refused():
            try:
                client.message({"n": 1}, [1])
            except CallError as error:
                self.assertEqual((error.domain, error.code), ("tarnwick.audio.reporting", 1))
                return True
            return False

        service.prefer(disable_reporting=True, device_name="bench 7")
        self.assertFalse(refused(), "preferences are read only at a notification")
        service.notify()
        eventually(refused, "reporting is off")
        service.prefer("disable_reporting = fal")
        service.notify()
        service.await_log("tarnwick.quarvel.toml")
        self.assertTrue(refused(), "a faulty file changes nothing")
        service.prefer(disable_reporting=False, device_name="bench 7", reporting_session_verbose=True,
                       reporting_server_verbose=True)
        service.notify()
        eventually(lambda: not refused(), "reporting is on")
        eventually(lambda: self.verbose_scopes(service, client) == {"zqrr", "zqrs"}, "verbose lines")
        service.prefer(disable_reporting=False, device_name="bench 7", reporting_session_verbose=True)
        service.notify()
        eventually(lambda: self.verbose_scopes(service, client) == {"zqrr"}, "verbose lines of sessions alone")
        client.stop_session(1)
        client.send("startReportingSessionForID:reply:", 1)
        client.stop_session(1)
        eventually(lambda: service.count("agent_session") == 2, "two runs")
        self.assertEqual(["device_name" in json.loads(row[0]) for row in service.rows(
            "SELECT user_info FROM agent_session ORDER BY id")], [False, True])

    def test_unwanted_events_are_not_recorded(self):
        service = self.service('[analytics]\nwanted = ["tarnwick.quarvel.HAL_*"]\n')
        client = self.client(service, session=1)
        for category in (3, 0x20000003, 0x10000003):
            client.message({}, [1], category)
        service.wait_for_rows(3, "message WHERE session_id = 1")
        client.stop_session(1)
        service.end()
        self.assertEqual([row["name"] for row in service.rows("SELECT name FROM analytics_event")],
                         ["tarnwick.quarvel.HAL_Playback.Start"])


class InternalBuild(ServiceTest):
    def test_the_history_is_written_with_its_orientations(self):
        service = self.prepared('[device]\nInternalBuild = true\n[orientation]\nsource = "files"\n')
        service.prefer(reporting_session_verbose=True)
        client = self.client(service.start())
        client.start_session(1, 7, {"HostApplicationDisplayID": "../../Music"})
        client.message({"volume level": 0.5}, [1], 11, 3)
        for mode in ("device", "ui"):
            (service.directory / f"run/{mode}-orientation").write_text("landscapeLeft\n")
            service.await_log(f'callback mode={mode} orientation="landscapeLeft" app="../../Music"')
        client.stop_session(1)
        row = service.wait_for_rows(1, "message WHERE category = 65535")[0]
        summary = json.loads(row["payload"])
        self.assertEqual((summary["ZQ_Session_Summary_Event"], summary["device_orientation"],
                          summary["ui_orientation"]), ("7", "landscapeLeft", "landscapeLeft"))
        self.assertGreaterEqual(float(summary["device_orientation_time"]), 0)
        file, = (service.directory / HISTORY).iterdir()
        self.assertRegex(file.name, r"^\d{8}-\d{6}[+-]\d{4}-quarvel-\.\._\.\._Music-longformaudio\.json$")
        self.assertEqual((service.directory / HISTORY).stat().st_mode & 0o777, 0o777)
        history = json.loads(file.read_text())
        self.assertEqual(history[0]["HostApplicationDisplayID"], "../../Music")
        self.assertEqual(history[1], {"Volume_Setup_1": {"volume_level": 0.5}})
        self.assertEqual([next(iter(entry)) for entry in history[2:]],
                         ["device_orientation", "ui_orientation"])


class Sensor(ServiceTest):
    """Orientation from the sensor proxy on the system bus."""

    def setUp(self):
        self.watched = self.prepared('[device]\nInternalBuild = true\n[orientation]\nsource = "iio"\n')
        self.watched.prefer(reporting_session_verbose=True)
        self.bus = SystemBus(self, self.watched.directory)
        self.watched.environment |= self.bus.environment
        self.tracker = self.client(self.watched.start())

    def await_claimants(self, count):
        eventually(lambda: self.bus.claimants() == count, f"{count} claimants")

    def turn(self, word, orientation):
        told = f'orientation="{orientation}"'
        before = self.watched.log().count(told)
        self.bus.turn(word)
        self.watched.await_log(told, before + 1)

    def await_error(self, number, words):
        self.watched.await_log(" error ", number)
        errors = [line for line in self.watched.log().splitlines() if " error " in line]
        self.assertIn(words, errors[-1])
        self.assertEqual(len(errors), number, errors)

    def fail_once(self, number, words):
        """Expects one line, although four sessions fail to track."""
        for _ in range(4):
            self.tracker.start_session(1, 7)
            self.await_error(number, words)
            self.tracker.stop_session(1)

    def succeed(self):
        self.tracker.start_session(1, 7)
        self.await_claimants(1)

    def test_it_is_claimed_while_a_session_tracks_it_and_after_a_restart(self):
        self.bus.begin()
        self.bus.begin_proxy(accelerometer_orientation="normal")
        self.await_claimants(0)
        self.succeed()
        for word, orientation in (("left-up", "landscapeRight"), ("right-up", "landscapeLeft"),
                                  ("bottom-up", "portraitUpsideDown"), ("undefined", "unknown"),
                                  ("normal", "portrait")):
            self.turn(word, orientation)
        self.bus.begin_proxy(accelerometer_orientation="left-up")
        # The new proxy is claimed, and its different orientation is reported.
        self.watched.await_log('orientation="landscapeRight"', 2)
        self.turn("normal", "portrait")
        self.tracker.stop_session(1)
        self.await_claimants(0)
        summary = json.loads(self.watched.wait_for_rows(1, "message WHERE category = 65535")[0]["payload"])
        self.assertEqual(summary["device_orientation"], "landscapeRight,landscapeLeft,portraitUpsideDown,"
                                                        "unknown,portrait,landscapeRight,portrait")
        self.assertNotIn(" error ", self.watched.log())

    def test_a_missing_bus_proxy_or_accelerometer_is_one_line(self):
        self.fail_once(1, "the system bus")
        # After a success the same failures are logged once more.
        self.bus.begin()
        self.bus.begin_proxy()
        self.succeed()
        self.turn("left-up", "landscapeRight")
        self.bus.end_proxy()
        self.tracker.stop_session(1)
        self.fail_once(2, "cannot be claimed")
        self.bus.begin_proxy()
        self.succeed()
        self.tracker.stop_session(1)
        self.bus.begin_proxy(has_accelerometer=False)
        self.fail_once(3, "no accelerometer")
        self.bus.begin_proxy()
        self.succeed()
        self.bus.end()
        self.await_error(4, "the system bus was lost")


class SystemBus:
    """A private system bus and a sensor proxy on it, which end with the test."""

    PROXY = "net.hadess.SensorProxy", "/net/hadess/SensorProxy", "org.freedesktop.DBus.Mock"

    def __init__(self, test, directory):
        self._directory = directory
        self._address = f"unix:path={directory}/system.sock"
        self.environment = {"DBUS_SYSTEM_BUS_ADDRESS": self._address}
        self._bus, self._proxy = (test.enterContext(contextlib.ExitStack()) for _ in range(2))

    def begin(self):
        (self._directory / "bus.conf").write_text(
            '<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN"'
            ' "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">'
            f"<busconfig><type>session</type><listen>{self._address}</listen><auth>EXTERNAL</auth>"
            '<policy context="default"><allow own="*"/><allow send_destination="*"/>'
            '<allow receive_sender="*"/><allow user="*"/></policy></busconfig>')
        self._run_beside(self._bus, "dbus-daemon", f"--config-file={self._directory}/bus.conf", "--nofork")
        eventually((self._directory / "system.sock").exists, "the bus")

    def begin_proxy(self, **parameters):
        self.end_proxy()
        self._run_beside(
            self._proxy, "/usr/bin/python3", "-m", "dbusmock", "--system", "--template", "iio-sensors-proxy",
            "-p", json.dumps({"has_accelerometer": True} | parameters), "-l", f"{self._directory}/proxy.log")
        self._gdbus("wait", "--system", "--timeout", "60", self.PROXY[0])

    def end(self):
        self._bus.close()

    def end_proxy(self):
        self._proxy.close()

    def _run_beside(self, stack, *command):
        process = stack.enter_context(
            subprocess.Popen(command, env=os.environ | self.environment, stderr=subprocess.DEVNULL))
        stack.callback(process.terminate)

    def _gdbus(self, *arguments):
        return subprocess.run(["gdbus", *arguments], env=os.environ | self.environment, check=True,
                              capture_output=True, text=True, timeout=PATIENCE).stdout

    def _call(self, method, *arguments):
        name, path, mock = self.PROXY
        return self._gdbus("call", "--system", "-d", name, "-o", path, "-m", f"{mock}.{method}", *arguments)

    def turn(self, word):
        self._call("SetInternalProperty", self.PROXY[0], "AccelerometerOrientation", f"<'{word}'>")

    def claimants(self):
        return self._call("GetInternalProperty", "AccelerometerOwners").count(":")
