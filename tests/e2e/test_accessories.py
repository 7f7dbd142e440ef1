"""The accessory registration report end to end: a mock BlueZ (python-dbusmock's bluez5 template)
and the real qvreportd on a private bus, accessory files in a temporary directory, trigger
messages and session stops sent as a client sends them."""

import datetime
import json
import os
import shutil
import subprocess
import tempfile
import time
import unittest

import dbus

from harness import Bus, Client, Daemon, jsonl_lines, wait_until

SUITE = "com.korvane.qvsound.qvreporting.audioreg"
TRIGGER = "Speaker, BT Headphones qwrT ( b71c ) ( 6402 ) , Microphone"
ROUTE_CHANGE = 10


def version_info(key, count=15, model="M4801"):
    """A "TELPVersionInfo" list whose elements say where they sit."""
    versions = [f"e{i}-{key}" for i in range(count)]
    versions[1] = model
    versions[3] = key
    if count > 14:
        versions[13] = 1699747200  # day 3 of its epoch week (weeks from Thursday 1 January 1970)
        versions[14] = 1699574400  # day 1
    return versions


def week_of_year(epoch):
    """Sunday-first weeks, week 1 being the week that holds 1 January (UTC)."""
    day = datetime.datetime.fromtimestamp(epoch, datetime.timezone.utc).date()
    sunday = day - datetime.timedelta(days=(day.weekday() + 1) % 7)
    if (sunday + datetime.timedelta(days=6)).year > day.year:
        return 1
    jan1 = datetime.date(day.year, 1, 1)
    first_sunday_week = jan1 - datetime.timedelta(days=(jan1.weekday() + 1) % 7)
    return (sunday - first_sunday_week).days // 7 + 1


class AccessoryTestCase(unittest.TestCase):
    def setUp(self):
        os.environ["TZ"] = "UTC0"  # the daemon inherits it: week numbers in UTC
        self.workdir = tempfile.mkdtemp(prefix="qv-e2e-bluez-")
        self.bus = Bus(self.workdir)
        self.connection = self.bus.connect()
        self.bluez = subprocess.Popen(
            ["/usr/bin/python3", "-m", "dbusmock", "--template", "bluez5"],
            env={**os.environ, "DBUS_SYSTEM_BUS_ADDRESS": self.bus.address},
            stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        wait_until(lambda: self.connection.name_has_owner("org.bluez"), what="the mock BlueZ")
        root = self.connection.get_object("org.bluez", "/")
        self.mock = dbus.Interface(root, "org.bluez.Mock")
        self.mock.AddAdapter("hci0", "bench")
        self.accessories = os.path.join(self.workdir, "accessories")
        os.makedirs(self.accessories)
        self.state = os.path.join(self.workdir, "state")
        os.makedirs(os.path.join(self.state, "defaults"))
        self.daemon = None
        self.clients = []

    def tearDown(self):
        status = 0
        if self.daemon:
            # Clients leave before the daemon is told to stop, so its exit status speaks of the
            # daemon's own shutdown alone.
            for client in self.clients:
                client.connection.close()
            left = "invalidationHandler: connection exited"
            wait_until(lambda: self.daemon.log_text().count(left) >= len(self.clients),
                       what="the clients to leave")
            status = self.daemon.stop()
        self.bluez.terminate()
        self.bluez.wait(timeout=10)
        self.connection.close()
        self.bus.stop()
        shutil.rmtree(self.workdir, ignore_errors=True)
        self.assertEqual(status, 0, "qvreportd left cleanly")

    def device(self, address, paired=True, connected=False, info=None):
        self.mock.AddDevice("hci0", address, "Earbuds")
        if paired:
            self.mock.PairDevice("hci0", address, dbus.Int32(0))
        if connected:
            self.mock.ConnectDevice("hci0", address)
        if info is not None:
            with open(os.path.join(self.accessories, address + ".json"), "w") as f:
                f.write(info if isinstance(info, str) else json.dumps(info))

    def start_daemon(self, paired, *extra):
        self.daemon = Daemon(self.bus, self.state, "--bluez-bus", self.bus.address,
                             "--accessory-dir", self.accessories, *extra)
        wait_until(lambda: "BlueZ: org.bluez is " in self.daemon.log_text()
                   and f"{paired} paired of" in self.daemon.log_text(),
                   what="the daemon to read BlueZ")

    def client(self):
        self.clients.append(Client(self.bus))
        return self.clients[-1]

    def suite(self):
        path = os.path.join(self.state, "defaults", SUITE + ".json")
        if not os.path.exists(path):
            return {}
        with open(path) as f:
            return json.load(f)

    def convo(self):
        """The registration report's lines of the convo sink, where every session also mirrors
        itself."""
        lines = jsonl_lines(os.path.join(self.state, "sinks", "convo.jsonl"))
        reports = {l["session"] for l in lines if l["op"] == "session"
                   and l["userInfo"].get("ClientName") == "Earlink_Telemetry"}
        return [l for l in lines if l["session"] in reports]

    def session_with_trigger(self, client, rid, config=None):
        client.create(rid, service_type=1, config=config)
        client.start(rid)
        client.send({"active_devices": TRIGGER}, ROUTE_CHANGE, 0, [rid])
        self.assertTrue(client.stop(rid))


class Gathering(AccessoryTestCase):
    def test_a_trigger_gathers_the_qualifying_devices_and_the_first_stop_only_schedules(self):
        good = {"TELPVersionInfo": version_info("K1"), "CaseInfo": {"CaseInfoVersion": "9"}}
        self.device("00:00:00:00:00:01", connected=True, info=good)
        self.device("00:00:00:00:00:02", info={**good, "TELPVersionInfo": version_info("K2")})
        self.device("00:00:00:00:00:03", info={**good, "TELPVersionInfo": version_info("K3", 14)})
        self.device("00:00:00:00:00:04", info={**good, "TELPVersionInfo": version_info("K4", 16)})
        self.device("00:00:00:00:00:05", info="{not json")
        self.device("00:00:00:00:00:06", paired=False, info=good)
        self.start_daemon(5)
        before = time.time()
        client = self.client()
        self.session_with_trigger(client, 100)
        after = time.time()

        suite = wait_until(lambda: "splunk" in self.suite().get("ELRegistrationInfo", {})
                           and self.suite(), what="the registration in the suite")
        entries = suite["ELRegistrationInfo"]["splunk"]
        self.assertEqual([e["AudioUUIDLeft"] for e in entries], ["e11-K1", "e11-K2"])
        # What each entry holds and how its dates are rounded is the workers' unit tests' part;
        # here, that BlueZ's connection state and the files reached them.
        first = entries[0]
        self.assertEqual(first["AudioUUIDRight"], "e12-K1")
        self.assertTrue(before <= first["lastConnectedEpoch"] <= after)
        self.assertEqual(entries[1]["lastConnectedEpoch"], 0, "never seen connected")
        self.assertEqual(list(suite["BTDevicesLastConnectedEpoch"]), ["K1"])
        self.assertTrue(before + 60 <= suite["AudioRegistrationELEnumerationCheckEpoch"] <= after + 60)
        # The first stop scheduled the first publication within a week and published nothing.
        nxt = suite["AudioRegistrationNextInvocationEpoch"]
        self.assertTrue(before <= nxt < after + 604800)
        self.assertEqual(self.convo(), [])

        log = self.daemon.log_text()
        self.assertIn("00:00:00:00:00:05.json refused: it is not JSON", log)


class Publication(AccessoryTestCase):
    def test_a_due_stop_publishes_each_active_device_with_its_week_number(self):
        with open(os.path.join(self.state, "defaults", SUITE + ".json"), "w") as f:
            json.dump({"AudioRegistrationNextInvocationEpoch": time.time() - 10}, f)
        good = {"TELPVersionInfo": version_info("K1"), "CaseInfo": {"CaseInfoVersion": "9"}}
        self.device("00:00:00:00:00:01", connected=True, info=good)
        self.device("00:00:00:00:00:02", info={**good, "TELPVersionInfo": version_info("K2")})
        self.start_daemon(2)
        client = self.client()
        before = time.time()
        self.session_with_trigger(client, 200, {"KXHostApplicationDisplayID": "com.example.app"})

        messages = wait_until(lambda: [l for l in self.convo() if l["op"] == "message"],
                              what="the publication")
        sessions = [l for l in self.convo() if l["op"] == "session"]
        self.assertEqual([s["sessionInfo"]["SessionID"] for s in sessions], [200])
        # A session of its own, never batched, under the application the client named.
        info = sessions[0]["sessionInfo"]
        self.assertEqual((info["BatchEvent"], info["ClientBundleID"]), (False, "com.example.app"))
        self.assertNotIn("ContainsRealtimeEvents", info)
        self.assertIn("HierarchyToken", info)
        self.assertEqual(list(sessions[0]["userInfo"].items()), [
            ("ClientName", "Earlink_Telemetry"), ("ServiceName", "Earlink_Registration"),
            ("HostApplicationDisplayID", "com.example.app"),
            ("KXHostApplicationDisplayID", "com.example.app")])
        # Only the device seen connected is active; it goes out with a week, not a time.
        self.assertEqual(len(messages), 1)
        message = messages[0]
        self.assertEqual((message["category"], message["type"]), (17, 11))
        self.assertEqual(message["payload"]["AudioUUIDLeft"], "e11-K1")
        self.assertNotIn("lastConnectedEpoch", message["payload"])
        self.assertEqual(message["payload"]["lastConnectedWW"], week_of_year(time.time()))
        suite = wait_until(lambda: self.suite().get("AudioRegistrationNextInvocationEpoch", 0)
                           > before + 604000 and self.suite(), what="the next publication")
        self.assertLess(suite["AudioRegistrationNextInvocationEpoch"], time.time() + 604800)
        self.assertIn("At least one active Bud connection detected since last publish. "
                      "Let's publish to Convo!", self.daemon.log_text())


class HostileDevices(AccessoryTestCase):
    def test_what_bluez_claims_never_names_a_file_outside_the_directory(self):
        # Files a hostile address could aim at, above the directory and in it.
        good = {"TELPVersionInfo": version_info("K1"), "CaseInfo": {"CaseInfoVersion": "9"}}
        with open(os.path.join(self.workdir, "passwd.json"), "w") as f:
            json.dump({**good, "TELPVersionInfo": version_info("P")}, f)
        with open(os.path.join(self.accessories, "AA:BB:CC:DD:EE:FF.json"), "w") as f:
            json.dump(good, f)
        generic = dbus.Interface(self.connection.get_object("org.bluez", "/"),
                                 "org.freedesktop.DBus.Mock")
        for name, address, paired in (("a", "../passwd", True), ("c", "aa:bb:cc:dd:ee:ff", True),
                                      ("d", dbus.UInt32(7), True),
                                      ("e", "AA:BB:CC:DD:EE:FF", "yes")):
            generic.AddObject(f"/org/bluez/hci0/dev_{name}", "org.bluez.Device1", dbus.Dictionary(
                {"Address": address, "Paired": paired, "Connected": True}, signature="sv"), [])
        self.start_daemon(3)  # a Paired that is no boolean pairs nothing
        self.session_with_trigger(self.client(), 400)

        # Only the well-formed address, in any case, has the information of its own file.
        suite = wait_until(lambda: "splunk" in self.suite().get("ELRegistrationInfo", {})
                           and self.suite(), what="the registration in the suite")
        self.assertEqual([e["AudioUUIDLeft"] for e in suite["ELRegistrationInfo"]["splunk"]],
                         ["e11-K1"])
        log = self.daemon.log_text()
        self.assertEqual(log.count("which is not a Bluetooth address"), 1)
        self.assertIn('dev_a has the address "../passwd", which is not a Bluetooth address', log)
        self.assertIn("Address of /org/bluez/hci0/dev_d is not a string", log)
        self.assertIn("Paired of /org/bluez/hci0/dev_e is not a boolean", log)


class NoBlueZ(AccessoryTestCase):
    def test_without_bluez_the_daemon_serves_and_gathers_nothing(self):
        self.daemon = Daemon(self.bus, self.state, "--bluez-bus",
                             "unix:path=" + os.path.join(self.workdir, "no-such-bus"),
                             "--accessory-dir", self.accessories)
        client = self.client()
        self.session_with_trigger(client, 300)
        log = wait_until(lambda: "There have been no BT enumerations" in self.daemon.log_text()
                         and self.daemon.log_text(), what="the stop")
        self.assertIn("cannot reach the bus unix:path=", log)
        self.assertIn("Timed Out waiting for BT Manager init", log)
        self.assertNotIn("splunk", self.suite().get("ELRegistrationInfo", {}))
        self.assertNotIn("AudioRegistrationNextInvocationEpoch", self.suite(), "nothing scheduled")
        self.assertIn(300, [int(r) for r in client.reporting.GetAllReporters()])


if __name__ == "__main__":
    unittest.main()
