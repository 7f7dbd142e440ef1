"""A fresh private dbus-daemon and a real qvreportd on a temporary state directory per test."""

import json
import os
import shutil
import signal
import subprocess
import tempfile
import time
import unittest

import dbus

BUS_NAME = "com.korvane.qvsound.Reporting"
OBJECT_PATH = "/com/korvane/qvsound/Reporting"
INTERFACE = "com.korvane.qvsound.Reporting"
STATS_INTERFACE = "com.korvane.qvsound.ReportingStats"
NOTIFY_PATH = "/com/korvane/qvsound/Notify"
NOTIFY_INTERFACE = "com.korvane.qvsound.Notify"

DAEMON = os.environ.get("QVREPORTD", "qvreportd")
SOURCE_DIR = os.environ.get("QV_SOURCE_DIR", os.path.join(os.path.dirname(__file__), "..", ".."))


def jsonl_lines(path):
    """The whole lines of a JSON-lines file, [] while there is none. What follows the last
    newline is a line still being written (one write can reach the file a page at a time, even
    mid-character): the next read has it."""
    if not os.path.exists(path):
        return []
    with open(path, "rb") as f:
        data = f.read()
    return [json.loads(line.decode()) for line in data.split(b"\n")[:-1] if line.strip()]


def wait_until(predicate, timeout=30.0, interval=0.02, what="condition"):
    deadline = time.monotonic() + timeout
    while True:
        value = predicate()
        if value:
            return value
        if time.monotonic() > deadline:
            raise AssertionError(f"timed out waiting for {what}")
        time.sleep(interval)


SYSTEM_LIKE_CONFIG = """<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>system</type>
  <listen>unix:path={socket}</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow user="*"/>
    <deny own="*"/>
    <deny send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_requested_reply="true" send_type="method_return"/>
    <allow send_requested_reply="true" send_type="error"/>
    <allow receive_type="method_call"/>
    <allow receive_type="method_return"/>
    <allow receive_type="error"/>
    <allow receive_type="signal"/>
    <allow send_destination="org.freedesktop.DBus" send_interface="org.freedesktop.DBus"/>
    <allow send_destination="org.freedesktop.DBus" send_interface="org.freedesktop.DBus.Introspectable"/>
  </policy>
  <!-- The daemon runs as root in the tests; the packaged policy names its own user. -->
  <policy user="root">
    <allow own="{name}"/>
  </policy>
  {policy}
</busconfig>
"""


class Bus:
    def __init__(self, workdir, system_like=False):
        self.workdir = workdir
        args = ["dbus-daemon", "--nofork", "--print-address=1"]
        if system_like:
            socket = os.path.join(workdir, "system_bus_socket")
            policy_file = os.path.join(SOURCE_DIR, "packaging", "com.korvane.qvsound.Reporting.conf")
            with open(policy_file) as f:
                packaged = f.read()
            body = packaged[packaged.index("<policy"):packaged.rindex("</busconfig>")]
            config = os.path.join(workdir, "bus.conf")
            with open(config, "w") as f:
                f.write(SYSTEM_LIKE_CONFIG.format(socket=socket, name=BUS_NAME, policy=body))
            os.chmod(workdir, 0o755)
            args.append(f"--config-file={config}")
        else:
            args.append("--session")
        # stderr is quiet: dbus-daemon complains that it may not raise its fd limit here.
        self.process = subprocess.Popen(args, stdout=subprocess.PIPE, stderr=subprocess.DEVNULL,
                                        text=True)
        self.address = self.process.stdout.readline().strip()

    def connect(self):
        return dbus.bus.BusConnection(self.address)

    def stop(self):
        self.process.terminate()
        self.process.wait(timeout=30)
        self.process.stdout.close()


class Daemon:
    def __init__(self, bus, state_dir, *extra, preexec_fn=None, timeout=30.0):
        self.state_dir = state_dir
        self.log_path = os.path.join(state_dir, "..", "qvreportd.log")
        self.log = open(self.log_path, "w")
        self.process = subprocess.Popen(
            [DAEMON, "--bus", bus.address, "--state-dir", state_dir, "--log-level", "debug", *extra],
            stderr=self.log, stdout=self.log, preexec_fn=preexec_fn)
        probe = bus.connect()
        wait_until(lambda: probe.name_has_owner(BUS_NAME) or self.process.poll() is not None,
                   timeout=timeout, what="the daemon to own its name")
        probe.close()
        if self.process.poll() is not None:
            raise RuntimeError("qvreportd exited: " + self.log_text())

    def log_text(self):
        with open(self.log_path, errors="replace") as f:
            return f.read()

    def sink_lines(self, sink):
        """Every line of a sink, across its closed segments (by name) and then the current one."""
        sinks = os.path.join(self.state_dir, "sinks")
        closed = sorted(n for n in os.listdir(sinks) if n.startswith(sink + ".")
                        and n.endswith(".jsonl") and n[len(sink) + 1:-6].isdigit()) \
            if os.path.isdir(sinks) else []
        return [line for name in closed + [sink + ".jsonl"]
                for line in jsonl_lines(os.path.join(sinks, name))]

    def events(self, prefix=""):
        return [l for l in self.sink_lines("analytics") if l["event"].startswith(prefix)]

    def stop(self):
        if self.process.poll() is None:
            self.process.send_signal(signal.SIGTERM)
        try:
            return self.process.wait(timeout=30)
        finally:
            self.log.close()


class Client:
    def __init__(self, bus):
        self.connection = bus.connect()
        obj = self.connection.get_object(BUS_NAME, OBJECT_PATH, introspect=False)
        self.reporting = dbus.Interface(obj, INTERFACE)
        self.stats = dbus.Interface(obj, STATS_INTERFACE)
        notify = self.connection.get_object(BUS_NAME, NOTIFY_PATH, introspect=False)
        self.notify = dbus.Interface(notify, NOTIFY_INTERFACE)

    def create(self, rid, service_type=None, config=None):
        assert self.reporting.CreateReportingSession(dbus.Int64(rid))
        if service_type is not None:
            assert self.reporting.SetServiceType(dbus.UInt16(service_type), dbus.Int64(rid))
        if config is not None:
            assert self.reporting.SetConfiguration(dbus.Dictionary(config, signature="sv"),
                                                   dbus.Int64(rid))

    def start(self, rid):  # the reply is held until the session stops
        self.reporting.StartReportingSession(dbus.Int64(rid), ignore_reply=True)

    def send(self, payload, category, type_, ids=()):
        self.reporting.SendMessage(dbus.Dictionary(payload, signature="sv"), dbus.UInt32(category),
                                   dbus.UInt16(type_), dbus.Array([dbus.Int64(i) for i in ids],
                                                                  signature="x"))

    def stop(self, rid):
        return bool(self.reporting.StopReportingSession(dbus.Int64(rid)))


class DirectClient(Client):
    """A client on the daemon's direct socket: a peer-to-peer connection, no bus in between."""

    def __init__(self, socket):
        self.connection = dbus.connection.Connection("unix:path=" + socket)
        obj = self.connection.get_object(None, OBJECT_PATH, introspect=False)
        self.reporting = dbus.Interface(obj, INTERFACE)
        self.stats = dbus.Interface(obj, STATS_INTERFACE)
        notify = self.connection.get_object(None, NOTIFY_PATH, introspect=False)
        self.notify = dbus.Interface(notify, NOTIFY_INTERFACE)


class DaemonTestCase(unittest.TestCase):
    system_like = False
    daemon_args = ()

    def setUp(self):
        self.workdir = tempfile.mkdtemp(prefix="qv-e2e-")
        self.bus = Bus(self.workdir, self.system_like)
        state = os.path.join(self.workdir, "state")
        os.makedirs(state)
        self.direct_socket = os.path.join(self.workdir, "direct")
        self.daemon = Daemon(self.bus, state, "--direct-socket", self.direct_socket,
                             *self.daemon_args)

    def tearDown(self):
        self.daemon.stop()
        self.bus.stop()
        shutil.rmtree(self.workdir, ignore_errors=True)

    def client(self):
        return Client(self.bus)

    def direct_client(self):
        return DirectClient(self.direct_socket)
