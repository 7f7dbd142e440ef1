"""A desktop notification service for tests: owns org.freedesktop.Notifications on the bus at
ADDRESS and appends each Notify call to OUT as a JSON line, before it answers.

    notification_server.py ADDRESS OUT [answer|hang]

"answer" (the default) replies with ids from 1; "hang" never replies. Prints "ready" once the
name is owned. Runs until killed.
"""

import json
import sys

import dbus
import dbus.service
from dbus.mainloop.glib import DBusGMainLoop
from gi.repository import GLib

IFACE = "org.freedesktop.Notifications"


class Notifications(dbus.service.Object):
    def __init__(self, bus, out, hang):
        super().__init__(bus, "/org/freedesktop/Notifications")
        self.out = out
        self.hang = hang
        self.next_id = 0
        self.held = []

    @dbus.service.method(IFACE, in_signature="susssasa{sv}i", out_signature="u",
                         async_callbacks=("reply", "error"))
    def Notify(self, app_name, replaces_id, app_icon, summary, body, actions, hints, timeout,
               reply, error):
        record = {"app_name": str(app_name), "replaces_id": int(replaces_id),
                  "app_icon": str(app_icon), "summary": str(summary), "body": str(body),
                  "actions": [str(a) for a in actions],
                  "hints": {str(k): int(v) if isinstance(v, (dbus.Byte, int)) else str(v)
                            for k, v in hints.items()},
                  "expire_timeout": int(timeout)}
        with open(self.out, "a") as f:
            f.write(json.dumps(record) + "\n")
        if self.hang:
            self.held.append(reply)
            return
        self.next_id += 1
        reply(dbus.UInt32(self.next_id))

    @dbus.service.method(IFACE, out_signature="as")
    def GetCapabilities(self):
        return ["body"]

    @dbus.service.method(IFACE, out_signature="ssss")
    def GetServerInformation(self):
        return ["test-notifications", "qvreporting tests", "1", "1.2"]


def main():
    address, out = sys.argv[1], sys.argv[2]
    hang = len(sys.argv) > 3 and sys.argv[3] == "hang"
    DBusGMainLoop(set_as_default=True)
    bus = dbus.bus.BusConnection(address)
    server = Notifications(bus, out, hang)
    name = dbus.service.BusName(IFACE, bus, do_not_queue=True)
    print("ready", flush=True)
    GLib.MainLoop().run()
    del server, name


if __name__ == "__main__":
    main()
