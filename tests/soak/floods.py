"""The flood scenarios of the soak: one local client doing what an unprivileged user could to
stall or exhaust the daemon, while another client's calls are timed.

- sessions: one connection creates and starts many sessions with every call in flight at once.
- held: starts of an already started session sent without expecting replies (by the rules never
  answered), which slip past the bus's limit of pending replies.
- sends: large unique messages sent with answers never read.

Each checks that the daemon lives on, that its counters say what happened, and that what it
holds goes back when the flooding client leaves; the time the flood took, the other client's
waits and the daemon's memory are figures, printed, never checked."""

import os
import subprocess
import time

from soaklib import Bus, Failure, log, wait_until

FULL_SIZES = {"sessions": 4096, "held": 200000, "sends": 1500}
SHORT_SIZES = {"sessions": 2000, "held": 20000, "sends": 300}
SEND_BYTES = 600 * 1024
# The daemon's default budget of one client's calls not yet answered (--max-call-bytes-per-client).
CALL_BYTES_PER_CLIENT = 16 << 20
# A payload rate the sends flood must pass however fast the daemon reads: at the default rate a
# slow daemon (a sanitizer build) reads the flood slower than the budget and refuses nothing.
PAYLOAD_BYTES_PER_SECOND = 2 << 20


class Flooder:
    """qv_soak_client in a flood mode; it prints one line when its flood is in, then waits."""

    def __init__(self, binary, bus, mode, *args):
        self.process = subprocess.Popen([binary, "--address", bus.address, mode, *args],
                                        stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)

    def first_line(self, timeout=600):
        line = []

        def read():
            line.append(self.process.stdout.readline())
            return True
        wait_until(lambda: read() and (line[-1] or self.process.poll() is not None),
                   timeout=timeout, what="the flood client's line")
        if not line[-1]:
            raise Failure(f"flood client exited: {self.process.stderr.read()}")
        return line[-1].split()

    def kill(self):
        if self.process.poll() is None:
            self.process.kill()
        self.process.wait()


def probe(binary, bus, seconds):
    """Another client's ReporterIDValid calls, every 10 ms: its figures line."""
    return subprocess.Popen([binary, "--address", bus.address, "probe", "--seconds", str(seconds)],
                            stdout=subprocess.PIPE, text=True)


def probe_figures(process):
    out, _ = process.communicate(timeout=600)
    return out.strip()


def run(soak):
    sizes = FULL_SIZES if soak.args.full else SHORT_SIZES
    c = soak.checks
    binary = soak.args.client
    log(f"== floods: {sizes}")
    bus = Bus(soak.new_dir("floods-bus"))
    try:
        daemon = soak.start_daemon(bus, soak.new_dir("floods"), "floods",
                                   "--max-payload-bytes-per-second",
                                   str(PAYLOAD_BYTES_PER_SECOND))
        try:
            rss_idle = daemon.rss_kib()
            soak.figure(f"floods: idle daemon RSS {rss_idle} KiB")

            # Sessions: the count of created sessions shows while they are held.
            watch = probe(binary, bus, 4)
            flooder = Flooder(binary, bus, "sessions", "--count", str(sizes["sessions"]))
            words = flooder.first_line()
            stats = daemon.stats()
            c.check(stats["sessions"] >= sizes["sessions"],
                    f"sessions flood: GetStats says {stats['sessions']} sessions, not "
                    f"{sizes['sessions']}")
            soak.figure(f"floods: {sizes['sessions']} sessions created and started in "
                        f"{words[3]} s; other client meanwhile: {probe_figures(watch)}; "
                        f"RSS {daemon.rss_kib()} KiB")
            flooder.kill()
            wait_until(lambda: daemon.stats()["sessions"] == 0, timeout=120,
                       what="the flooder's sessions to go")

            # Held starts: let go as soon as they are known to get no answer.
            flooder = Flooder(binary, bus, "held", "--count", str(sizes["held"]),
                              "--first-id", "7")
            flooder.first_line()
            stats = daemon.stats()
            c.check(stats["held_calls"] <= 1 and stats["calls_awaiting_reply"] <= 1,
                    f"held flood: {stats['held_calls']} held and {stats['calls_awaiting_reply']} "
                    "calls kept after starts that get no answer")
            soak.figure(f"floods: RSS after {sizes['held']} unanswerable starts "
                        f"{daemon.rss_kib()} KiB")
            flooder.kill()

            # Sends never read: refused past the client's budget, everyone else served.
            watch = probe(binary, bus, 6)
            flooder = Flooder(binary, bus, "sends", "--count", str(sizes["sends"]),
                              "--bytes", str(SEND_BYTES), "--first-id", "9")
            flooder.first_line()
            wait_until(lambda: probe_done(watch), timeout=120, what="the probe")
            stats = daemon.stats()
            refused = (stats["limit_exceeded_call_bytes_per_client"]
                       + stats["limit_exceeded_payload_rate_per_client"])
            c.check(refused > 0, "sends flood: no call was refused past the client's budgets")
            # One call may pass the budget by its own size: it is checked before decoding.
            bound = CALL_BYTES_PER_CLIENT + 3 * SEND_BYTES
            c.check(stats["call_bytes_max"] <= bound,
                    f"sends flood: {stats['call_bytes_max']} bytes of calls in flight, more "
                    f"than {bound}")
            soak.figure(f"floods: {sizes['sends']} unread {SEND_BYTES // 1024} KiB sends: "
                        f"{refused} refused, at most {stats['call_bytes_max']} bytes in flight, "
                        f"RSS {daemon.rss_kib()} KiB; other client meanwhile: "
                        f"{probe_figures(watch)}")
            flooder.kill()
            wait_until(lambda: daemon.stats()["call_bytes"] == 0, timeout=120,
                       what="the refused client's calls to drain")
            c.check(daemon.alive(), "floods: the daemon died")
        finally:
            status = daemon.terminate()
            c.check(status == 0, f"floods: SIGTERM gave exit status {status}, not 0")
            reports = daemon.sanitizer_reports()
            c.check(not reports, f"floods: sanitizer reports {reports}")
    finally:
        bus.stop()


def probe_done(process):
    return process.poll() is not None or time.sleep(0.2)
