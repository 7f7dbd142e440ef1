"""Helpers of the fault soak (soak.py): the daemon under test, the load clients and readers of
the sink files."""

import json
import os
import signal
import subprocess
import sys
import threading

HERE = os.path.dirname(os.path.abspath(__file__))
SOURCE_DIR = os.path.dirname(os.path.dirname(HERE))
sys.path.insert(0, os.path.join(SOURCE_DIR, "tests", "e2e"))

import dbus  # noqa: E402

from harness import (BUS_NAME, INTERFACE, NOTIFY_INTERFACE, NOTIFY_PATH, OBJECT_PATH,  # noqa: E402
                     STATS_INTERFACE, Bus, wait_until)  # Bus: for the scenarios


PLAYBACK_START = "Playback.Start"
SUMMARY = "Session_Generic.Summary"
UPTIME_EVENT = "com.korvane.qvsound.qvreportingclientuptime"
# The soak's sessions set no service type, so their service events carry the name "unknown".
SERVICE_PREFIX = "com.korvane.unknown."
CLIENT_COMM = "qv_soak_client"
SANITIZER_MARKS = ("ERROR: AddressSanitizer", "ERROR: LeakSanitizer", "runtime error:",
                   "SUMMARY: UndefinedBehaviorSanitizer", "WARNING: ThreadSanitizer")


class Failure(Exception):
    pass


class Checks:
    """Collects failed checks instead of stopping at the first, so one run says all it found."""

    def __init__(self):
        self.failed = []

    def check(self, ok, what):
        if not ok:
            self.failed.append(what)
            print(f"  FAILED: {what}", flush=True)
        return ok


def log(text):
    print(text, flush=True)


# ---- the daemon ---------------------------------------------------------------------------------

class SoakDaemon:
    """The real qvreportd on a state directory, its log in a file beside it."""

    def __init__(self, binary, bus, state_dir, log_path, *extra):
        self.bus = bus
        self.state_dir = state_dir
        self.log_path = log_path
        env = dict(os.environ)
        env["ASAN_OPTIONS"] = "detect_leaks=1:abort_on_error=1"
        env["UBSAN_OPTIONS"] = "print_stacktrace=1:halt_on_error=1"
        self.log = open(log_path, "a")
        self.process = subprocess.Popen(
            [binary, "--bus", bus.address, "--state-dir", state_dir, "--log-level", "default",
             *extra], stdout=self.log, stderr=self.log, env=env)
        probe = bus.connect()
        try:
            wait_until(lambda: probe.name_has_owner(BUS_NAME) or self.process.poll() is not None,
                       timeout=60, what="the daemon to own its name")
        finally:
            probe.close()
        if self.process.poll() is not None:
            raise Failure(f"qvreportd exited at start ({self.process.returncode}):\n"
                          + self.log_text()[-4000:])
        self.connection = bus.connect()
        obj = self.connection.get_object(BUS_NAME, OBJECT_PATH, introspect=False)
        self.reporting = dbus.Interface(obj, INTERFACE)
        self.stats_iface = dbus.Interface(obj, STATS_INTERFACE)
        notify = self.connection.get_object(BUS_NAME, NOTIFY_PATH, introspect=False)
        self.notify = dbus.Interface(notify, NOTIFY_INTERFACE)

    @property
    def pid(self):
        return self.process.pid

    def alive(self):
        return self.process.poll() is None

    def stats(self):
        return {str(k): int(v) if isinstance(v, (dbus.Int64, dbus.UInt64, dbus.Int32,
                                                  dbus.UInt32, dbus.Boolean)) else v
                for k, v in self.stats_iface.GetStats(timeout=60).items()}

    def reporters(self):
        return sorted(int(r) for r in self.reporting.GetAllReporters(timeout=60))

    def rss_kib(self):
        with open(f"/proc/{self.pid}/status") as f:
            for line in f:
                if line.startswith("VmRSS:"):
                    return int(line.split()[1])
        return -1

    def log_text(self):
        if not self.log.closed:
            self.log.flush()
        with open(self.log_path, errors="replace") as f:
            return f.read()

    def sanitizer_reports(self):
        text = self.log_text()
        return [mark for mark in SANITIZER_MARKS if mark in text]

    def terminate(self, timeout=60):
        """SIGTERM; returns the exit status (None when it did not leave in time, and is killed)."""
        if self.alive():
            self.process.send_signal(signal.SIGTERM)
        return self._reap(timeout)

    def kill(self):
        if self.alive():
            self.process.kill()
        return self._reap(30)

    def _reap(self, timeout):
        try:
            status = self.process.wait(timeout=timeout)
        except subprocess.TimeoutExpired:
            self.process.kill()
            self.process.wait()
            status = None
        self.connection.close()
        self.log.close()
        return status


def check_clean_exit(checks, daemon, status, what):
    checks.check(status == 0, f"{what}: SIGTERM gave exit status {status}, not 0")
    reports = daemon.sanitizer_reports()
    checks.check(not reports, f"{what}: sanitizer report in {daemon.log_path}: {reports}")


# ---- the clients --------------------------------------------------------------------------------

class LoadClient:
    """One qv_soak_client process; its stdout is followed on a thread."""

    def __init__(self, binary, bus, first_id, sessions, messages, answers, depth=32, padding=0,
                 progress=500, keep_sessions=False):
        self.first_id = first_id
        self.rids = list(range(first_id, first_id + sessions))
        self.sessions = sessions
        self.messages = messages
        self.answers_path = answers
        args = [binary, "--address", bus.address, "--first-id", str(first_id), "--sessions",
                str(sessions), "--messages", str(messages), "--depth", str(depth), "--padding",
                str(padding), "--progress", str(progress), "--answers", answers]
        if keep_sessions:
            args.append("--keep-sessions")
        self.started = threading.Event()
        self.done_line = None
        self.answered = 0
        self.killed = False
        self.process = subprocess.Popen(args, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                                        text=True)
        self.reader = threading.Thread(target=self._follow, daemon=True)
        self.reader.start()

    def _follow(self):
        for line in self.process.stdout:
            words = line.split()
            if not words:
                continue
            if words[0] == "started":
                self.started.set()
            elif words[0] == "progress":
                self.answered = int(words[1])
            elif words[0] == "done":
                self.done_line = line.strip()

    def messages_for(self, rid):
        """Messages the client sends to one of its sessions (round robin)."""
        index = rid - self.first_id
        return self.messages // self.sessions + (1 if index < self.messages % self.sessions else 0)

    def kill(self):
        self.killed = True
        self.process.kill()

    def wait(self, timeout):
        try:
            status = self.process.wait(timeout=timeout)
        except subprocess.TimeoutExpired:
            self.process.kill()
            status = self.process.wait()
            raise Failure(f"client {self.first_id} did not end within {timeout} s")
        finally:
            self.reader.join(timeout=5)
        return status

    def stderr(self):
        return self.process.stderr.read() if self.process.stderr else ""

    def answers(self):
        """(rid, seq, monotonic ns) of every call answered without error."""
        out = []
        if not os.path.exists(self.answers_path):
            return out
        with open(self.answers_path) as f:
            for line in f:
                rid, seq, ns = line.split()
                out.append((int(rid), int(seq), int(ns)))
        return out


# ---- the sinks ----------------------------------------------------------------------------------

class SinkReader:
    """Follows a sink file: reads only what was appended since the last call. Lines that do not
    parse are kept (with their number) for the checks; a last line without its line feed waits for
    the next call."""

    def __init__(self, path):
        self.path = path
        self.offset = 0
        self.line_count = 0
        self.bad = []

    def read_new(self):
        if not os.path.exists(self.path):
            return []
        with open(self.path, "rb") as f:
            f.seek(self.offset)
            data = f.read()
        end = data.rfind(b"\n")
        if end < 0:
            return []
        self.offset += end + 1
        out = []
        for raw in data[:end].split(b"\n"):
            self.line_count += 1
            try:
                out.append(json.loads(raw))
            except ValueError:
                self.bad.append((self.line_count, raw[:200]))
        return out


class AnalyticsIndex:
    """What the analytics sink holds for the soak's sessions, by reporter ID."""

    def __init__(self, state_dir):
        self.reader = SinkReader(os.path.join(state_dir, "sinks", "analytics.jsonl"))
        self.qvsound = {}  # rid -> set of seq of com.korvane.qvsound.Playback.Start
        self.service = {}  # rid -> set of seq of com.korvane.unknown.Playback.Start
        self.summaries = {}  # rid -> [summary payloads of com.korvane.qvsound...Summary]
        self.service_summaries = {}  # rid -> count of com.korvane.unknown...Summary
        self.uptime = []  # payloads of the client uptime event
        self.duplicates = 0

    def update(self):
        for line in self.reader.read_new():
            event = line.get("event", "")
            payload = line.get("payload") or {}
            if event == UPTIME_EVENT:
                self.uptime.append(payload)
                continue
            app = payload.get("HostApplicationDisplayID", "")
            if not isinstance(app, str) or not app.startswith("soak."):
                continue
            rid = int(app[5:])
            if event.endswith(PLAYBACK_START):
                if event.startswith("com.korvane.qvsound."):
                    target = self.qvsound
                elif event.startswith(SERVICE_PREFIX):
                    target = self.service
                else:
                    continue
                seqs = target.setdefault(rid, set())
                if payload["soak_seq"] in seqs:
                    self.duplicates += 1
                seqs.add(payload["soak_seq"])
            elif event == "com.korvane.qvsound." + SUMMARY:
                self.summaries.setdefault(rid, []).append(payload)
            elif event == SERVICE_PREFIX + SUMMARY:
                self.service_summaries[rid] = self.service_summaries.get(rid, 0) + 1
        return self

    def has_summaries(self, rids):
        self.update()
        return all(rid in self.summaries and rid in self.service_summaries for rid in rids)


def unparsable_lines(state_dir):
    """(file, line number, start of line) of every sink line that is not a JSON object, and of a
    last line without its line feed."""
    bad = []
    sinks = os.path.join(state_dir, "sinks")
    if not os.path.isdir(sinks):
        return bad
    for name in sorted(os.listdir(sinks)):
        path = os.path.join(sinks, name)
        with open(path, "rb") as f:
            data = f.read()
        if data and not data.endswith(b"\n"):
            bad.append((name, "end", data[data.rfind(b"\n") + 1:][:80]))
        for number, raw in enumerate(data.split(b"\n")[:-1], 1):
            try:
                if not isinstance(json.loads(raw), dict):
                    raise ValueError
            except ValueError:
                bad.append((name, number, raw[:80]))
    return bad


def torn_sinks(state_dir):
    """Sink files whose last line has no line feed."""
    sinks = os.path.join(state_dir, "sinks")
    torn = []
    for name in sorted(os.listdir(sinks)) if os.path.isdir(sinks) else []:
        with open(os.path.join(sinks, name), "rb") as f:
            f.seek(0, os.SEEK_END)
            if f.tell() == 0:
                continue
            f.seek(-1, os.SEEK_END)
            if f.read(1) != b"\n":
                torn.append(name)
    return torn


def whole_lines(path):
    """The file's bytes up to and including its last line feed."""
    with open(path, "rb") as f:
        data = f.read()
    return data[:data.rfind(b"\n") + 1]
