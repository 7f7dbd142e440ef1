"""The packaged bus policy on a system-like private bus: any user may report, only root may kill."""

import os
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.dirname(__file__))
from harness import BUS_NAME, DaemonTestCase, INTERFACE, OBJECT_PATH, wait_until  # noqa: E402

UNPRIVILEGED = "nobody"

CLIENT = """
import dbus, sys
bus = dbus.bus.BusConnection(sys.argv[1])
r = dbus.Interface(bus.get_object({name!r}, {path!r}, introspect=False), {iface!r})
print("create", bool(r.CreateReportingSession(dbus.Int64(31))))
print("reporters", [int(x) for x in r.GetAllReporters()])
try:
    r.KillService()
    print("kill allowed")
except dbus.exceptions.DBusException as e:
    print("kill refused", e.get_dbus_name())
print("still there", bool(r.CreateReportingSession(dbus.Int64(32))))
""".format(name=BUS_NAME, path=OBJECT_PATH, iface=INTERFACE)


@unittest.skipUnless(os.geteuid() == 0, "switching to an unprivileged user needs root")
class BusPolicy(DaemonTestCase):
    system_like = True

    def test_an_unprivileged_user_reports_but_cannot_kill_while_root_can(self):
        out = subprocess.run(["runuser", "-u", UNPRIVILEGED, "--", "/usr/bin/python3", "-c", CLIENT,
                              self.bus.address], capture_output=True, text=True, timeout=60)
        self.assertEqual(out.returncode, 0, out.stderr)
        lines = out.stdout.splitlines()
        self.assertIn("create True", lines)
        self.assertIn("reporters [31]", lines)
        self.assertIn("kill refused org.freedesktop.DBus.Error.AccessDenied", lines)
        self.assertIn("still there True", lines)

        root = self.client()
        root.reporting.KillService(ignore_reply=True)
        self.assertEqual(self.daemon.process.wait(timeout=10), 2)
        self.assertIn("DESTROYING SERVICE", self.daemon.log_text())


if __name__ == "__main__":
    unittest.main(verbosity=2)
