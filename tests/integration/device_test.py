"""What feeds and steers the installed service: driver counters, orientation, preferences, properties."""

import json
import os
import subprocess
import unittest

from harness import CallError, ServiceTest, eventually

HISTORY = "diagnostics/private/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/Audio/Reporting"


class Drivers(ServiceTest):
    def test_a_session_reports_how_far_counters_rose(self):
        service = self.prepared()
        tree = service.directory / "tallix"

        def set_counter(channel, value):
            (tree / channel).parent.mkdir(parents=True, exist_ok=True)
            (tree / channel).write_text(f"{value}\n")

        (service.directory / "irq").write_text("           CPU0 CPU1\n 9:  100 2  audio\n")
        set_counter("Speaker/underruns", 5)
        set_counter("Board/MCA/clips", 10)
        set_counter("Haptics/Stats/taps", 3)
        set_counter("Unrelated/other", 1)
        (service.directory / "etc/quarvel.toml").write_text(
            f'[tallix]\nroot = "{tree}"\n'
            f'[[tallix.channel]]\ngroup = "VorrenMXDrv"\nname = "interrupts"\n'
            f'file = "{service.directory}/irq"\npattern = "9: +([0-9]+).*audio"\n')
        service.start()
        self.addCleanup(service.finish)
        client = self.client(service)
        client.start_session(1)
        set_counter("Speaker/underruns", 12)
        set_counter("Board/MCA/clips", 9)
        set_counter("Unrelated/other", 99)
        (service.directory / "irq").write_text("           CPU0 CPU1\n 9:  142 2  audio\n")
        client.stop_session(1)
        rows = service.wait_for_rows(1, "message WHERE category = 9")
        self.assertEqual(json.loads(rows[0]["payload"]),
                         {"VorrenMXDrv_interrupts": 42, "Speaker_underruns": 7})
        client.start_session(1)
        (tree / "Speaker/underruns").unlink()
        set_counter("Haptics/Stats/taps", 4)
        client.stop_session(1)
        rows = service.wait_for_rows(2, "message WHERE category = 9")
        self.assertEqual(json.loads(rows[1]["payload"]), {"Haptics_Stats_taps": 1},
                         "a channel that vanished takes its own group along, and no other")
        self.assertIn("TallixCreateSamples error", service.log())


class Preferences(ServiceTest):
    def test_reporting_is_switched_off_and_on(self):
        service = self.service()
        client = self.client(service)
        client.start_session(1)
        service.wait_for_rows(1, "agent_session")

        def refused():
            try:
                client.message({"n": 1}, [1])
            except CallError as error:
                self.assertEqual((error.domain, error.code), ("tarnwick.audio.reporting", 1))
                return True
            return False

        service.prefer(disable_reporting=True, device_name="bench 7")
        self.assertFalse(refused(), "nothing is read before the notification")
        service.notify()
        eventually(refused, "reporting is off")
        service.write_preferences("disable_reporting = fal")
        service.notify()
        eventually(lambda: "tarnwick.quarvel.toml" in service.log(), "a line that names the file")
        self.assertTrue(refused(), "a slip of the pen changes nothing")
        service.prefer(disable_reporting=False, device_name="bench 7", reporting_session_verbose=True)
        service.notify()
        eventually(lambda: not refused() and " debug tarnwick.quarvel[zqrr] " in service.log(),
                   "reporting is on, and the session's verbose lines")
        client.stop_session(1)
        client.send("startReportingSessionForID:reply:", 1)
        client.stop_session(1)
        eventually(lambda: service.count("agent_session") == 2, "two runs")
        self.assertEqual(["device_name" in json.loads(row[0]) for row in service.rows(
            "SELECT user_info FROM agent_session ORDER BY id")], [False, True])

    def test_unwanted_events_are_not_recorded(self):
        service = self.service('[analytics]\nwanted = ["tarnwick.quarvel.HAL_*"]\n')
        client = self.client(service)
        client.start_session(1)
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
        service.start()
        self.addCleanup(service.finish)
        client = self.client(service)
        client.start_session(1, 7, {"HostApplicationDisplayID": "../../Music"})
        client.message({"volume level": 0.5}, [1], 11, 3)
        for mode in ("device", "ui"):
            (service.directory / f"run/{mode}-orientation").write_text("landscapeLeft\n")
            eventually(lambda: f'callback mode={mode} orientation="landscapeLeft" app="../../Music"'
                       in service.log(), f"the {mode} handler is called")
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

    def test_without_a_bus_there_is_no_orientation_and_no_harm(self):
        service = self.prepared('[device]\nInternalBuild = true\n[orientation]\nsource = "iio"\n')
        service.environment["DBUS_SYSTEM_BUS_ADDRESS"] = f"unix:path={service.directory}/nobus"
        service.start()
        self.addCleanup(service.finish)
        client = self.client(service)
        client.start_session(1, 2)
        client.message({"a": 1}, [1])
        client.stop_session(1)
        service.wait_for_rows(2, "message WHERE session_id = 1")

    def test_orientation_comes_from_the_sensor_proxy_while_a_session_tracks_it(self):
        service = self.prepared('[device]\nInternalBuild = true\n[orientation]\nsource = "iio"\n')
        service.prefer(reporting_session_verbose=True)
        bus = SystemBus(self, service.directory)
        service.environment |= bus.environment
        service.start()
        self.addCleanup(service.finish)
        client = self.client(service)
        client.start_session(1, 7)
        eventually(lambda: bus.claimants() == 1, "the session's claim on the sensor")
        for word, orientation in (("left-up", "landscapeRight"), ("bottom-up", "portraitUpsideDown")):
            bus.turn(word)
            eventually(lambda: f'orientation="{orientation}"' in service.log(), orientation)
        client.stop_session(1)
        eventually(lambda: bus.claimants() == 0, "the claim's end with the session")
        summary = json.loads(service.wait_for_rows(1, "message WHERE category = 65535")[0]["payload"])
        self.assertEqual(summary["device_orientation"], "landscapeRight,portraitUpsideDown")


class SystemBus:
    """A private system bus with a sensor proxy on it; both end with the test."""

    PROXY = "net.hadess.SensorProxy", "/net/hadess/SensorProxy", "org.freedesktop.DBus.Mock"

    def __init__(self, test, directory):
        self._test = test
        address = f"unix:path={directory}/system.sock"
        self.environment = {"DBUS_SYSTEM_BUS_ADDRESS": address}
        (directory / "bus.conf").write_text(
            '<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN"'
            ' "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">'
            f"<busconfig><type>session</type><listen>{address}</listen><auth>EXTERNAL</auth>"
            '<policy context="default"><allow own="*"/><allow send_destination="*"/>'
            '<allow receive_sender="*"/><allow user="*"/></policy></busconfig>')
        self._beside("dbus-daemon", f"--config-file={directory}/bus.conf", "--nofork", "--nopidfile")
        eventually((directory / "system.sock").exists, "the bus")
        self._beside("/usr/bin/python3", "-m", "dbusmock", "--system", "--template", "iio-sensors-proxy",
                     "-p", '{"has_accelerometer": true}', "-l", f"{directory}/proxy.log")
        self._gdbus("wait", "--system", "--timeout", "60", self.PROXY[0])

    def _beside(self, *command):
        process = subprocess.Popen(command, env=os.environ | self.environment,
                                   stderr=subprocess.DEVNULL)
        self._test.addCleanup(process.wait)
        self._test.addCleanup(process.terminate)

    def _gdbus(self, *arguments):
        return subprocess.run(["gdbus", *arguments], env=os.environ | self.environment, check=True,
                              capture_output=True, text=True).stdout

    def _call(self, method, *arguments):
        name, path, mock = self.PROXY
        return self._gdbus("call", "--system", "-d", name, "-o", path, "-m", f"{mock}.{method}", *arguments)

    def turn(self, word):
        self._call("SetInternalProperty", self.PROXY[0], "AccelerometerOrientation", f"<'{word}'>")

    def claimants(self):
        return self._call("GetInternalProperty", "AccelerometerOwners").count(":")


if __name__ == "__main__":
    unittest.main(verbosity=2)
