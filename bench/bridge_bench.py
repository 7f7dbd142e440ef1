"""The bridge's cost: its CPU (a share of one core) and memory while 8 streams play and each
changes its volume 10 times a second, beside pw-top's figures for the same graph in the same run
and PipeWire's own CPU.

    /usr/bin/python3 bench/bridge_bench.py BUILD_DIR [--seconds N]
"""

import argparse
import os
import shutil
import subprocess
import sys
import tempfile
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "tests",
                                "bridge"))
import pwharness  # noqa: E402  (puts tests/e2e on the path)
import harness  # noqa: E402
from pwharness import Bridge, Bus, Daemon, PipeWire, wait_until  # noqa: E402

STREAMS = 8
VOLUME_RATE = 10
TICKS = os.sysconf("SC_CLK_TCK")


def cpu_seconds(pid):
    with open(f"/proc/{pid}/stat") as f:
        fields = f.read().rsplit(")", 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / TICKS  # utime + stime


def memory_kib(pid, key):
    with open(f"/proc/{pid}/status") as f:
        for line in f:
            if line.startswith(key + ":"):
                return int(line.split()[1])
    return 0


def seconds(text):
    for unit, scale in (("us", 1e-6), ("µs", 1e-6), ("ms", 1e-3), ("s", 1.0)):
        if text.endswith(unit):
            return float(text[:-len(unit)]) * scale
    return 0.0


def pw_top_screen(env, session):
    out = subprocess.run(["tmux", "capture-pane", "-p", "-t", session], env=env,
                         capture_output=True, text=True)
    return out.stdout


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("build")
    parser.add_argument("--seconds", type=float, default=20)
    args = parser.parse_args()
    build = os.path.abspath(args.build)
    harness.DAEMON = os.path.join(build, "qvreportd")
    pwharness.BRIDGE = os.path.join(build, "qvreport-pipewire")

    workdir = tempfile.mkdtemp(prefix="qv-bridge-bench-")
    pw = bus = daemon = bridge = None
    tmux = f"qvbench{os.getpid()}"
    try:
        pw = PipeWire(workdir)
        bus = Bus(workdir)
        state = os.path.join(workdir, "state")
        os.makedirs(state)
        daemon = Daemon(bus, state)
        daemon.log.close()  # the daemon's debug lines are not the subject
        bridge = Bridge(pw, bus.address, workdir)
        env = dict(pw.env, TERM="xterm")
        env["TMUX_TMPDIR"] = workdir
        subprocess.run(["tmux", "new-session", "-d", "-s", tmux, "-x", "160", "-y", "40",
                        "pw-top"], env=env, check=True)
        streams = subprocess.Popen([os.path.join(build, "qv_bridge_test_streams"), "--streams",
                                    str(STREAMS), "--volume-rate", str(VOLUME_RATE),
                                    "--seconds", str(args.seconds + 8), "--app-id", "bench"],
                                   env=pw.env)
        # Settle: every stream linked and running, the sessions made.
        wait_until(lambda: bridge.text().count("session ") >= STREAMS, timeout=30,
                   what="the streams' sessions")
        time.sleep(3)
        bridge_pid, pipewire_pid = bridge.process.pid, pw.pipewire.pid
        b0, p0, t0 = cpu_seconds(bridge_pid), cpu_seconds(pipewire_pid), time.monotonic()
        sent0 = len(daemon.events("com.korvane.qvsound.Volume.State"))
        time.sleep(args.seconds)
        b1, p1, t1 = cpu_seconds(bridge_pid), cpu_seconds(pipewire_pid), time.monotonic()
        sent1 = len(daemon.events("com.korvane.qvsound.Volume.State"))
        rss, hwm = memory_kib(bridge_pid, "VmRSS"), memory_kib(bridge_pid, "VmHWM")
        screen = pw_top_screen(env, tmux)
        streams.wait(timeout=60)
    finally:
        subprocess.run(["tmux", "kill-session", "-t", tmux], env=dict(os.environ,
                                                                     TMUX_TMPDIR=workdir),
                       capture_output=True)
        for stop in (bridge, daemon, pw):
            if stop is not None:
                stop.stop()
        if bus is not None:
            bus.stop()
        shutil.rmtree(workdir, ignore_errors=True)

    elapsed = t1 - t0
    lines = screen.splitlines()
    header = next((line for line in lines if "B/Q" in line), "")
    rows = [line for line in lines if len(line.split()) > 2 and line.split()[1].isdigit()]
    # The driver's row: from the cycle's start (signal) to the whole graph's finish is WAIT + BUSY;
    # its share of the cycle's length (QUANT / RATE) is the graph's load.
    columns = header.split()
    driver = next((dict(zip(columns, r.split())) for r in rows
                   if r.split()[-1] == "qvtest-speakers"), None)
    graph = None
    if driver and driver.get("RATE", "0") != "0":
        cycle = int(driver["QUANT"]) / int(driver["RATE"])
        spent = seconds(driver["WAIT"]) + seconds(driver["BUSY"])
        graph = (spent, cycle)

    print(f"qvreport-pipewire: {STREAMS} streams, each changing its volume {VOLUME_RATE} times a "
          f"second, measured over {elapsed:.1f} s")
    print(f"  volume changes reported to the daemon: {sent1 - sent0} "
          f"({(sent1 - sent0) / elapsed:.0f}/s; the streams made {STREAMS * VOLUME_RATE}/s)")
    print(f"  bridge CPU:   {100 * (b1 - b0) / elapsed:6.2f} % of one core   (target < 1 %)")
    print(f"  PipeWire CPU: {100 * (p1 - p0) / elapsed:6.2f} % of one core   (the server running "
          f"the same graph, same window)")
    print(f"  bridge memory: {rss / 1024:.1f} MiB resident, {hwm / 1024:.1f} MiB at most "
          f"(target < 10 MiB)")
    if graph is not None:
        print(f"  pw-top:       {100 * graph[0] / graph[1]:6.2f} % of each cycle spent on the graph "
              f"(its driver's WAIT + BUSY, {1e6 * graph[0]:.0f} us of {1e3 * graph[1]:.2f} ms)")
    print("  pw-top for the same graph at the end of the window (B/Q: the share of each cycle a "
          "node was busy):")
    for line in [header] + rows:
        print("    " + line.rstrip())


if __name__ == "__main__":
    main()
