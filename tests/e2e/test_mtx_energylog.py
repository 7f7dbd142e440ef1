"""The MTX and EnergyLog sinks of the real qvreportd, read as their consumers would: the MTX
record through protoc and the shipped schema, and through qvreportctl."""

import base64
import os
import subprocess
import sys
import time
import unittest

import dbus

sys.path.insert(0, os.path.dirname(__file__))
from harness import DaemonTestCase, SOURCE_DIR, DAEMON, jsonl_lines, wait_until  # noqa: E402

IO, GENERIC = 7, 1
ISSUE_DETECTOR, ENERGY_LOG = 7, 8
PROTO_DIR = os.path.join(SOURCE_DIR, "data")
QVREPORTCTL = os.path.join(os.path.dirname(DAEMON), "qvreportctl")


def sink_lines(daemon, name):
    return jsonl_lines(os.path.join(daemon.state_dir, "sinks", name + ".jsonl"))


def protoc(wire, *arguments):
    return subprocess.run(["protoc", *arguments], input=wire, capture_output=True,
                          check=True).stdout.decode()


def decode(wire):
    return protoc(wire, "--decode=mtxmetrics.AudioIssueDetected", "--proto_path=" + PROTO_DIR,
                  "audio_issue_detected.proto")


class MTXSink(DaemonTestCase):
    def test_an_issue_detector_message_becomes_a_record_protoc_decodes_with_the_schema(self):
        c = self.client()
        # Sent while no session runs, it goes to the shared session, which the worker serves too.
        c.send({"issue_type": "shared", "node": "n", "rtaid_client": "c",
                "any_channel_silence_seconds": 1}, IO, ISSUE_DETECTOR)
        wait_until(lambda: sink_lines(self.daemon, "mtx"), what="the shared session's record")
        c.create(70)
        c.start(70)
        c.send({"issue_type": "dropout", "node": dbus.Int32(12), "rtaid_client": "com.example",
                "any_channel_silence_seconds": dbus.Int32(-3)}, IO, ISSUE_DETECTOR, [70])
        # Values of other kinds in every field, and no keys at all: records all the same.
        c.send({"issue_type": dbus.Dictionary({"a": dbus.Array([1.5], signature="d")},
                                              signature="sv"),
                "node": float("nan"), "rtaid_client": dbus.Boolean(True),
                "any_channel_silence_seconds": "  42 seconds"}, GENERIC, ISSUE_DETECTOR, [70])
        c.send({}, GENERIC, ISSUE_DETECTOR, [70])
        c.send({"issue_type": "not an issue"}, IO, GENERIC, [70])
        wait_until(lambda: len(sink_lines(self.daemon, "mtx")) >= 4,
                   what="four records in the mtx sink")
        self.assertEqual(self.daemon.stop(), 0)
        records = sink_lines(self.daemon, "mtx")
        self.assertEqual(len(records), 4, "only type 7 makes a record")
        self.assertEqual([list(r) for r in records], [["time", "seq", "metric", "record"]] * 4)
        self.assertEqual({r["metric"] for r in records}, {5963779})

        shared, *wires = [base64.b64decode(r["record"], validate=True) for r in records]
        self.assertEqual(decode(shared),
                         'duration: 1\nissuetype: "shared"\nnode: "n"\nrtaidclient: "c"\n')
        self.assertEqual(decode(wires[0]),
                         'duration: -3\nissuetype: "dropout"\nnode: "12"\n'
                         'rtaidclient: "com.example"\n')
        self.assertEqual(protoc(wires[0], "--decode_raw"),
                         '2: 18446744073709551613\n3: "dropout"\n4: "12"\n5: "com.example"\n')
        self.assertEqual(decode(wires[1]),
                         'duration: 42\nissuetype: "{\\n    a = (\\n        1.5\\n    );\\n}"\n'
                         'node: "nan"\nrtaidclient: "1"\n')
        self.assertEqual(decode(wires[2]),
                         'duration: 0\nissuetype: ""\nnode: ""\nrtaidclient: ""\n')
        log = self.daemon.log_text()
        for key in ("issue_type", "rtaid_client", "node", "any_channel_silence_seconds"):
            self.assertEqual(log.count(f"Failed to get {key} for AudioIssueDetected"), 1, key)

        if os.path.exists(QVREPORTCTL):  # beside the daemon in a build tree
            shown = subprocess.run([QVREPORTCTL, "--state-dir", self.daemon.state_dir, "sinks",
                                    "mtx"], capture_output=True, check=True, text=True).stdout
            self.assertIn(' mtx {"metric":5963779} AudioIssueDetected { duration: -3 '
                          'issuetype: "dropout" node: "12" rtaidclient: "com.example" }\n', shown)


class EnergyLogSink(DaemonTestCase):
    def test_haptics_messages_become_registry_28_events_in_a_fixed_order(self):
        c = self.client()
        # Sent while no session runs, it goes to the shared session, which the worker serves too.
        c.send({"EngineState": "EngineOn"}, IO, ENERGY_LOG)
        wait_until(lambda: sink_lines(self.daemon, "energylog"), what="the shared session's event")
        c.create(80, config={"KXHostApplicationDisplayID": "com.example.game"})
        c.start(80)
        c.create(81)  # no application name: "Unknown"
        c.start(81)
        stamp = time.time() - 30  # the records' end time is the message's, not the daemon's now
        c.send({"EngineOnTime": 12.5, "EngineState": "EngineOn", "qvreporting_timestamp": stamp,
                "Haptic_Active_Hardware_Time_Seconds": dbus.Int64(3600),
                "Active_Clients": dbus.Array(["a", "b"], signature="s")},
               GENERIC, ENERGY_LOG, [80])
        c.send({"EngineOnTime": dbus.Int32(3), "EngineState": dbus.Int32(1)}, IO, ENERGY_LOG, [81])
        c.send({"EngineOnTime": 1}, IO, ISSUE_DETECTOR, [80])  # another type: nothing
        c.send({"EngineOnTimeX": 1, "enginestate": "EngineOn"}, IO, ENERGY_LOG, [80])  # nor this
        # Status 1 is for exactly the text "EngineOn".
        for state in ("engineon", "EngineOn ", True, float("nan"),
                      dbus.Array(["EngineOn"], signature="s")):
            c.send({"EngineState": state}, IO, ENERGY_LOG, [80])
        wait_until(lambda: len(sink_lines(self.daemon, "energylog")) >= 11,
                   what="eleven energy-log events")
        self.assertEqual(self.daemon.stop(), 0)
        events = sink_lines(self.daemon, "energylog")
        self.assertEqual(len(events), 11)
        self.assertEqual({e["registry"] for e in events}, {28})
        self.assertEqual([list(e) for e in events],
                         [["time", "seq", "registry", "event", "payload"]] * 11)
        self.assertEqual([e["event"] for e in events],
                         ["Vantrel_Haptics_ClientStatus", "Vantrel_Haptics_EngineOnDuration",
                          "Vantrel_Haptics_ClientStatus", "LeakedHapticsSessionInfo",
                          "Vantrel_Haptics_EngineOnDuration"] +
                         ["Vantrel_Haptics_ClientStatus"] * 6)
        shared, on, status, leaked, unknown_on, unknown_status, *states = (e["payload"]
                                                                           for e in events)
        self.assertEqual(shared["Status"], 1)
        self.assertEqual(list(on), ["EngineOnDuration", "ApplicationName", "TimestampEnd"])
        self.assertEqual((on["EngineOnDuration"], on["ApplicationName"]), (12.5, "com.example.game"))
        self.assertEqual(on["TimestampEnd"], stamp)
        self.assertEqual((status["Status"], status["ApplicationName"]), (1, "com.example.game"))
        self.assertIs(type(status["Status"]), int)
        self.assertEqual([s["Status"] for s in states], [0] * 5)
        self.assertEqual(leaked, {"Haptic_Active_Hardware_Time_Seconds": 3600,
                                  "Active_Clients": ["a", "b"]})
        # "Unknown" is left out and logged in one record, kept in the other.
        self.assertEqual(list(unknown_on), ["EngineOnDuration", "TimestampEnd"])
        self.assertEqual((unknown_status["Status"], unknown_status["ApplicationName"]),
                         (0, "Unknown"))
        self.assertEqual(self.daemon.log_text().count("failed to get app name for energylog"), 1)


if __name__ == "__main__":
    unittest.main(verbosity=2)
