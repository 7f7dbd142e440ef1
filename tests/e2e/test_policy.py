"""The packaged bus policy on a system-like private bus: any user may report, only root may kill."""

import os
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.dirname(__file__))
from harness import BUS_NAME, DaemonTestCase, INTERFACE, OBJECT_PATH  # noqa: E402

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
""".format(name=BUS_NAME, path=OBJECT_PATH, iface=INTERFACE)


@unittest.skipUnless(os.geteuid() == 0, "switching to an unprivileged user needs root")
class BusPolicy(DaemonTestCase):
    system_like = True

    def test_an_unprivileged_user_reports_but_cannot_kill_while_root_can(self):
        out = subprocess.run(["runuser", "-u", "nobody", "--", "/usr/bin/python3", "-c", CLIENT,
                              self.bus.address], capture_output=True, text=True, timeout=60)
        self.assertEqual(out.returncode, 0, out.stderr)
        self.assertEqual(out.stdout.splitlines(), [
            "create True", "reporters [31]", "kill refused org.freedesktop.DBus.Error.AccessDenied"])
        self.client().reporting.KillService(ignore_reply=True)
        self.assertEqual(self.daemon.process.wait(timeout=30), 2)


if __name__ == "__main__":
    unittest.main(verbosity=2)
