"""A headless PipeWire with WirePlumber on a private session bus and a private XDG_RUNTIME_DIR,
with two null sinks (speakers, headphones) and a null source made by a config drop-in; the real
qvreportd on a bus of its own (tests/e2e/harness.py) and the bridge between them.

Every process is started by PID and stopped by PID; every socket stays inside the work dir."""

import json
import os
import shutil
import signal
import subprocess
import sys
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "e2e"))
from harness import Bus, Daemon, wait_until  # noqa: E402

BRIDGE = os.environ.get("QVREPORT_PIPEWIRE", "qvreport-pipewire")

# Null sinks: a timer drives each (no sound card needed), and a description says what it is.
PIPEWIRE_DROP_IN = """
context.objects = [
  { factory = adapter args = { factory.name = support.null-audio-sink node.name = "qvtest-speakers"
      node.description = "Built-in Speakers" media.class = "Audio/Sink" audio.position = [ FL FR ]
      monitor.channel-volumes = true object.linger = true } }
  { factory = adapter args = { factory.name = support.null-audio-sink
      node.name = "qvtest-headphones" node.description = "Wired Headphones"
      media.class = "Audio/Sink" audio.position = [ FL FR ] monitor.channel-volumes = true
      object.linger = true } }
  { factory = adapter args = { factory.name = support.null-audio-sink node.name = "qvtest-mic"
      node.description = "Null Microphone" media.class = "Audio/Source" audio.position = [ FL FR ]
      object.linger = true } }
]
"""

# No hardware monitors; streams start at full volume and on the default sink every time (no
# state restored from an earlier test).
WIREPLUMBER_MAIN = """
alsa_monitor.enabled = false
v4l2_monitor.enabled = false
libcamera_monitor.enabled = false
stream_defaults.properties["restore-props"] = false
stream_defaults.properties["restore-target"] = false
"""
WIREPLUMBER_BLUETOOTH = "bluez_monitor.enabled = false\n"

START_TIMEOUT = 30.0


class PipeWireUnavailable(Exception):
    pass


class PipeWire:
    """pipewire and wireplumber on a private runtime dir and session bus."""

    def __init__(self, workdir):
        self.workdir = workdir
        self.runtime = os.path.join(workdir, "runtime")
        self.config = os.path.join(workdir, "config")
        os.makedirs(self.runtime, mode=0o700, exist_ok=True)
        os.makedirs(os.path.join(self.config, "pipewire", "pipewire.conf.d"), exist_ok=True)
        os.makedirs(os.path.join(self.config, "wireplumber", "main.lua.d"), exist_ok=True)
        os.makedirs(os.path.join(self.config, "wireplumber", "bluetooth.lua.d"), exist_ok=True)
        with open(os.path.join(self.config, "pipewire", "pipewire.conf.d", "50-qvtest.conf"),
                  "w") as f:
            f.write(PIPEWIRE_DROP_IN)
        with open(os.path.join(self.config, "wireplumber", "main.lua.d", "90-qvtest.lua"), "w") as f:
            f.write(WIREPLUMBER_MAIN)
        with open(os.path.join(self.config, "wireplumber", "bluetooth.lua.d", "90-qvtest.lua"),
                  "w") as f:
            f.write(WIREPLUMBER_BLUETOOTH)
        for tool in ("pipewire", "wireplumber", "pw-play", "pw-dump", "wpctl", "sox"):
            if shutil.which(tool) is None:
                raise PipeWireUnavailable(f"{tool} is not installed (scripts/setup installs it)")
        self.session_bus = Bus(workdir)
        self.env = dict(os.environ)
        for key in ("PIPEWIRE_REMOTE", "PIPEWIRE_CONFIG_DIR", "PULSE_SERVER"):
            self.env.pop(key, None)
        self.env.update({
            "XDG_RUNTIME_DIR": self.runtime,
            "PIPEWIRE_RUNTIME_DIR": self.runtime,
            "XDG_CONFIG_HOME": self.config,
            "XDG_STATE_HOME": os.path.join(workdir, "xdg-state"),
            "XDG_DATA_HOME": os.path.join(workdir, "xdg-data"),
            "DBUS_SESSION_BUS_ADDRESS": self.session_bus.address,
            "PIPEWIRE_LOG_SYSTEMD": "false",
        })
        self.pipewire = None
        self.wireplumber = None
        self.start()

    def log(self, name):
        return open(os.path.join(self.workdir, name), "a")

    def start(self):
        with self.log("pipewire.log") as log:
            self.pipewire = subprocess.Popen(["pipewire"], env=self.env, stdout=log, stderr=log)
        try:
            wait_until(lambda: os.path.exists(os.path.join(self.runtime, "pipewire-0"))
                       or self.pipewire.poll() is not None, timeout=START_TIMEOUT,
                       what="pipewire's socket")
        except AssertionError:
            pass
        if self.pipewire.poll() is not None or not os.path.exists(
                os.path.join(self.runtime, "pipewire-0")):
            raise PipeWireUnavailable("pipewire did not start: " + self.tail("pipewire.log"))
        with self.log("wireplumber.log") as log:
            self.wireplumber = subprocess.Popen(["wireplumber"], env=self.env, stdout=log,
                                                stderr=log)
        # WirePlumber is ready once it has chosen a default sink.
        wait_until(lambda: self.default_sink() == "qvtest-speakers"
                   or self.wireplumber.poll() is not None, timeout=START_TIMEOUT,
                   what="WirePlumber to choose a default sink")
        if self.wireplumber.poll() is not None:
            raise PipeWireUnavailable("wireplumber exited: " + self.tail("wireplumber.log"))

    def tail(self, name):
        with open(os.path.join(self.workdir, name), errors="replace") as f:
            return f.read()[-2000:]

    def run(self, *args, check=True):
        return subprocess.run(list(args), env=self.env, capture_output=True, text=True,
                              timeout=30, check=check)

    def dump(self):
        try:
            return json.loads(self.run("pw-dump", check=False).stdout or "[]")
        except json.JSONDecodeError:
            return []

    def default_sink(self):
        for obj in self.dump():
            if obj.get("type") == "PipeWire:Interface:Metadata" and \
                    obj.get("props", {}).get("metadata.name") == "default":
                for entry in obj.get("metadata") or []:
                    if entry.get("key") == "default.audio.sink":
                        value = entry.get("value")
                        return value.get("name") if isinstance(value, dict) else None
        return None

    def streams(self, media_class="Stream/Output/Audio"):
        """{node id: node properties} of the stream nodes now in the graph."""
        out = {}
        for obj in self.dump():
            if obj.get("type") == "PipeWire:Interface:Node":
                props = (obj.get("info") or {}).get("props") or {}
                if props.get("media.class") == media_class:
                    out[obj["id"]] = props
        return out

    def stream_of(self, app_id, media_class="Stream/Output/Audio"):
        return wait_until(lambda: next((i for i, p in self.streams(media_class).items()
                                        if p.get("application.id") == app_id), None),
                          timeout=START_TIMEOUT, what=f"the stream of {app_id}")

    def play(self, path, app_id, role="Music", *extra):
        props = '{ application.id = "%s" }' % app_id
        return subprocess.Popen(["pw-play", "--media-role", role, "-P", props, *extra, path],
                                env=self.env, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)

    def stop_server(self):
        for process in (self.wireplumber, self.pipewire):
            if process is not None and process.poll() is None:
                process.terminate()
                try:
                    process.wait(timeout=10)
                except subprocess.TimeoutExpired:
                    process.kill()
                    process.wait()

    def stop(self):
        self.stop_server()
        self.session_bus.stop()


def make_tone(path, seconds, rate=48000, channels=2):
    subprocess.run(["sox", "-n", "-r", str(rate), "-c", str(channels), "-b", "16", path, "synth",
                    str(seconds), "sine", "440", "vol", "0.2"], check=True)


class Bridge:
    def __init__(self, pipewire, bus_address, workdir, *extra):
        self.log_path = os.path.join(workdir, "bridge.log")
        self.log = open(self.log_path, "a")
        self.process = subprocess.Popen([BRIDGE, "--bus", bus_address, "--log-level", "debug",
                                         *extra], env=pipewire.env, stdout=self.log,
                                        stderr=self.log)
        wait_until(lambda: "connected to PipeWire" in self.text() or
                   self.process.poll() is not None, timeout=START_TIMEOUT,
                   what="the bridge to connect to PipeWire")

    def text(self):
        with open(self.log_path, errors="replace") as f:
            return f.read()

    def stop(self):
        if self.process.poll() is None:
            self.process.send_signal(signal.SIGTERM)
        try:
            status = self.process.wait(timeout=30)
        finally:
            self.log.close()
        # Under the sanitizer presets a report fails the test, whatever else passed.
        text = self.text()
        if "Sanitizer" in text or "runtime error:" in text:
            raise AssertionError("sanitizer report in the bridge's log:\n" + text[-6000:])
        return status


def payloads(daemon, event):
    return [e["payload"] for e in daemon.events(event) if e["event"] == event]


def with_app(daemon, event, app_id):
    return [p for p in payloads(daemon, event) if p.get("HostApplicationDisplayID") == app_id]


def wait_for(daemon, event, app_id, count=1, what=None, timeout=30.0):
    return wait_until(lambda: len(with_app(daemon, event, app_id)) >= count and
                      with_app(daemon, event, app_id), timeout=timeout,
                      what=what or f"{count} {event} of {app_id}")


def now():
    return time.monotonic()
