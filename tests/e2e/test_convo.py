"""The Convo sink end to end: a session mirrored into sinks/convo.jsonl by the real daemon, then
the service switched off through its defaults suite with qvreportctl."""

import os
import struct
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.dirname(__file__))
from harness import DAEMON, DaemonTestCase, jsonl_lines, wait_until  # noqa: E402

# Built beside qvreportd.
CTL = os.environ.get("QVREPORTCTL", os.path.join(os.path.dirname(DAEMON), "qvreportctl"))
SUITE = "com.korvane.qvsound.convo"
DSP_PLAYBACK, STATE, TELEPHONY, TEST, API_USAGE = 0x10000004, 18, 2, 11, 12


class ConvoReporting(DaemonTestCase):
    def lines(self):
        return jsonl_lines(os.path.join(self.daemon.state_dir, "sinks", "convo.jsonl"))

    def defaults_write(self, key, value):
        subprocess.run([CTL, "--bus", self.bus.address, "--state-dir", self.daemon.state_dir,
                        "defaults", "write", SUITE, key, value], check=True,
                       stdout=subprocess.DEVNULL)

    def run_session(self, rid, count, service_type=TELEPHONY,
                    config={"KXHostApplicationDisplayID": "com.example.call"}):
        c = self.client()
        c.create(rid, service_type=service_type, config=config)
        c.start(rid)
        for i in range(count):
            c.send({"i": i, "label": f"m{i}"}, DSP_PLAYBACK, STATE, [rid])
        self.assertTrue(c.stop(rid))

    def test_a_session_reaches_the_sink_in_order_and_a_switched_off_service_gets_nothing(self):
        self.run_session(20, 3, service_type=TEST)  # a test session is not mirrored
        self.run_session(21, 30)
        lines = wait_until(lambda: [l for l in self.lines() if l["op"] == "flush"] and self.lines(),
                           what="the Convo session flushed")
        session, *rest = lines
        self.assertEqual(session["op"], "session")
        info = session["sessionInfo"]
        self.assertEqual(list(info.items()), [
            ("ClientType", 19), ("ClientVersion", struct.unpack("f", struct.pack("f", 2.1))[0]),
            ("SessionID", 21), ("BatchEvent", True), ("HierarchyToken", info["HierarchyToken"]),
            ("ContainsRealtimeEvents", False), ("ClientBundleID", "com.example.call")])
        self.assertEqual(list(session["userInfo"].items()), [
            ("ClientName", "com.korvane.qvsound"), ("QVReportingSessionID", 21),
            ("ServiceName", "telephony_session"), ("HostApplicationDisplayID", "com.example.call"),
            ("KXHostApplicationDisplayID", "com.example.call")])

        messages = [l for l in rest if l["op"] == "message"]
        self.assertTrue(all(l["session"] == session["session"] for l in rest))
        self.assertEqual([m["payload"]["i"] for m in messages[:30]], list(range(30)))
        self.assertEqual({(m["category"], m["type"]) for m in messages[:30]}, {(4, STATE)})
        self.assertFalse(any("qvreporting_timestamp" in m["payload"] for m in messages),
                         "a customer build keeps its times")
        # The summary comes last (the messages derived at stop before it), then the flush.
        summary = messages[-1]
        self.assertEqual((summary["category"], summary["type"]), (0xFFFF, 0xFFFF))
        self.assertEqual(summary["payload"]["QV_Session_Summary_Event"], str(TELEPHONY))
        self.assertEqual(summary["payload"]["i"], ",".join(str(i) for i in range(30)))
        self.assertEqual(summary["payload"]["label"], ",".join(f"m{i}" for i in range(30)))
        self.assertEqual(rest[-1]["op"], "flush")
        self.assertEqual(rest[-2], summary)

        # No backends: the session is described, then nothing follows it. API usage goes in real
        # time; configuration entries go to user info, over the worker's own.
        self.defaults_write("Backends", "[]")
        self.run_session(22, 3, service_type=API_USAGE, config={"ServiceName": "mine", "n": 7})
        wait_until(lambda: "failed to find backend" in self.daemon.log_text(),
                   what="the empty backend list")
        # Switched off: not even a session.
        self.defaults_write("Enabled", "false")
        self.run_session(23, 3)
        wait_until(lambda: "newHierarchyTokenFromParentToken returned nil" in self.daemon.log_text(),
                   what="the refused token")
        self.assertEqual(self.daemon.stop(), 0)  # every sink line written by now
        after = self.lines()[len(lines):]
        self.assertEqual([l["op"] for l in after], ["session"])
        info = after[0]["sessionInfo"]
        self.assertEqual((info["SessionID"], info["BatchEvent"], info["ContainsRealtimeEvents"]),
                         (22, False, True))
        self.assertNotIn("ClientBundleID", info)
        self.assertEqual(list(after[0]["userInfo"].items()), [
            ("ClientName", "com.korvane.qvsound"), ("QVReportingSessionID", 22),
            ("ServiceName", "mine"), ("n", 7)])
        log = self.daemon.log_text()
        # Each message of both sessions dropped, the three sent and those derived at stop.
        self.assertGreaterEqual(log.count("Session never started. -[QVReportingSessionConvoWorker "
                                          "handleMessage:]_block_invoke"), 6)
        self.assertEqual(log.count("Session never started. -[QVReportingSessionConvoWorker "
                                   "stop]_block_invoke"), 2)


if __name__ == "__main__":
    unittest.main(verbosity=2)
