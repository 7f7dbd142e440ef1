"""scripts/demo --pipewire: a few seconds of real sound through a headless PipeWire (null sinks,
WirePlumber), qvreport-pipewire between it and qvreportd, then the sessions and the messages the
daemon derived from them, by application."""

import json
import os
import signal
import subprocess
import sys
import tempfile
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests",
                                "bridge"))
import pwharness  # noqa: E402  (puts tests/e2e on the path)
import harness  # noqa: E402
from pwharness import Bridge, Bus, Daemon, PipeWire, make_tone, wait_for  # noqa: E402


def show(event):
    p = event["payload"]
    name = event["event"].replace("com.korvane.qvsound.", "")
    keys = {
        "Playback.Start": ["KXSessionVolume", "active_devices", "session_selected_format"],
        "Playback.Stop": ["session_output_running"],
        "Record.Stop": ["session_input_running"],
        "Volume.State": ["KXSessionVolume"],
        "RouteChange.State": ["active_devices"],
        "Record.Start": ["active_devices", "session_selected_format"],
        "Volume.Summary": ["play_seconds", "KXSessionVolume", "active_devices", "msgidx",
                           "msgcnt"],
        "Input.Summary": ["inputrunning_seconds", "active_devices"],
        "Session_Generic.Summary": ["summaryServiceName", "num_messages"],
    }.get(name)
    if keys is None:
        return None
    fields = ", ".join(f"{k}={round(p[k], 2) if isinstance(p[k], float) else p[k]}"
                       for k in keys if k in p)
    return f"    {name:26} {fields}"


def main():
    build = os.path.abspath(sys.argv[1])
    harness.DAEMON = os.path.join(build, "qvreportd")
    pwharness.BRIDGE = os.path.join(build, "qvreport-pipewire")
    work = tempfile.mkdtemp(prefix="qvreport-pipewire-demo.")
    print(f"== a headless PipeWire with WirePlumber, qvreportd and qvreport-pipewire in {work}")
    pw = PipeWire(work)
    bus = Bus(work)
    state = os.path.join(work, "state")
    os.makedirs(state)
    daemon = Daemon(bus, state)
    bridge = Bridge(pw, bus.address, work)
    try:
        song, ping = os.path.join(work, "song.wav"), os.path.join(work, "ping.wav")
        make_tone(song, 5)
        make_tone(ping, 1, rate=44100, channels=1)
        print("== playing a 5 s song (Music) on the speakers; halfway the user turns it down to "
              "0.5 and moves it to the headphones")
        player = pw.play(song, "org.example.Music", "Music")
        wait_for(daemon, "com.korvane.qvsound.Playback.Start", "org.example.Music")
        node = pw.stream_of("org.example.Music")
        print("== a 1 s notification sound and a 2 s call recording from the microphone")
        notifier = pw.play(ping, "org.example.Mail", "Notification")
        recorder = subprocess.Popen(["pw-record", "--media-role", "Communication", "-P",
                                     '{ application.id = "org.example.Call" }',
                                     os.path.join(work, "call.wav")], env=pw.env)
        time.sleep(2)
        recorder.send_signal(signal.SIGINT)
        pw.run("wpctl", "set-volume", str(node), "0.5")
        time.sleep(1.5)
        pw.run("pw-metadata", str(node), "target.object", "qvtest-headphones")
        for p in (player, notifier, recorder):
            p.wait(timeout=30)
        wait_for(daemon, "com.korvane.qvsound.Volume.Summary", "org.example.Music", 3)
    finally:
        bridge.stop()
        daemon.stop()
        pw.stop()
        bus.stop()

    print("== the sessions qvreport-pipewire made (its log)")
    for line in bridge.text().splitlines():
        if ": session " in line or "stopped:" in line:
            print("    " + line.split(": ", 1)[1])
    print(f"== what reached the analytics sink, by application ({state}/sinks/analytics.jsonl)")
    by_app = {}
    with open(os.path.join(state, "sinks", "analytics.jsonl")) as f:
        for line in f:
            event = json.loads(line)
            if event["event"].startswith("com.korvane.qvsound."):
                by_app.setdefault(event["payload"].get("HostApplicationDisplayID"), []).append(event)
    for app, events in by_app.items():
        lines = [text for text in map(show, events) if text]
        if lines:
            print(f"  {app}")
            print("\n".join(lines))
    print(f"== every event: {os.path.join(build, 'qvreportctl')} --state-dir {state} sinks "
          "analytics")


if __name__ == "__main__":
    main()
