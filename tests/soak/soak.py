#!/usr/bin/python3
"""Fault soak of qvreportd: the real daemon on a private bus, loaded by many clients, while
clients die, the daemon is stopped or killed under load, and its state directory fills up, turns
read-only or holds garbage.

    tests/soak/soak.py [--full] [--seed N] [--only churn,sigterm,sigkill,faults]
                       [--daemon PATH] [--client PATH] [--keep]

The short form (the default, what CI runs) runs every scenario once with a few clients; --full
runs 50 clients of 10^4 messages each and repeats the stop and kill scenarios. The daemon should
be the asan-ubsan build (scripts/soak builds it): it runs with detect_leaks=1 and abort_on_error=1
and every one of its logs is searched for sanitizer reports. The load and the floods come from
qv_soak_client (tests/soak/soak_client.cpp), one process per client.

Scenarios:
  churn    clients killed with SIGKILL at random points while their start calls are held; their
           sessions must be stopped (gone from GetAllReporters, each summary in the sink), what
           survivors were answered must be in the sink, and the daemon's resident memory must come
           back to within 10 % of its level after a warm-up round
  sigterm  SIGTERM under pipelined load, with clients leaving the bus meanwhile: exit 0, and every
           call answered before the signal has both its analytics events in the sink
  sigkill  SIGKILL of the daemon while it writes, then a restart on the same state directory: the
           sinks are whole JSON lines again after the first write, torn tails removed and counted
  faults   a full disk (a small tmpfs), a read-only state directory (a read-only bind mount) and
           garbage defaults files: the daemon says so, keeps answering, counts what it lost and
           writes again once it can (needs root for the mounts; --skip-mounts leaves those out)

Every check that fails is printed and the script exits 1; the figures of each scenario are printed
as it goes.
"""

import argparse
import os
import random
import shutil
import signal
import subprocess
import sys
import tempfile
import time

import dbus

import floods

from soaklib import (BUS_NAME, CLIENT_COMM, INTERFACE, OBJECT_PATH, SOURCE_DIR, AnalyticsIndex, Bus,
                     Checks, Failure, LoadClient, SoakDaemon, check_clean_exit, log, torn_sinks,
                     unparsable_lines, wait_until, whole_lines)

# What each form does. Messages are per client, spread over its sessions.
SHORT = dict(churn_clients=10, churn_messages=2000, churn_sessions=2, churn_kill_fraction=0.5,
             churn_rss=False, sigterm_rounds=2, sigterm_clients=6, sigterm_leavers=4,
             sigkill_clients=4, faults_messages=400)
FULL = dict(churn_clients=50, churn_messages=10000, churn_sessions=2, churn_kill_fraction=0.4,
            churn_rss=True, sigterm_rounds=5, sigterm_clients=16, sigterm_leavers=8,
            sigkill_clients=8, faults_messages=2000)


# ---- the run ------------------------------------------------------------------------------------

class Soak:
    def __init__(self, args, profile):
        self.args = args
        self.profile = profile
        self.rng = random.Random(args.seed)
        self.checks = Checks()
        self.workdir = tempfile.mkdtemp(prefix="qv-soak-", dir=args.workdir)
        self.next_id = 1000
        self.figures = []

    def ids(self, count):
        first = self.next_id
        self.next_id += count
        return first

    def new_dir(self, name):
        path = os.path.join(self.workdir, name)
        os.makedirs(path, exist_ok=True)
        return path

    def start_daemon(self, bus, state_dir, name, *extra):
        return SoakDaemon(self.args.daemon, bus, state_dir,
                          os.path.join(self.workdir, name + ".log"), *extra)

    def client(self, bus, sessions, messages, **kw):
        first = self.ids(sessions)
        answers = os.path.join(self.workdir, "answers", f"{first}.txt")
        os.makedirs(os.path.dirname(answers), exist_ok=True)
        return LoadClient(self.args.client, bus, first, sessions, messages, answers, **kw)

    def figure(self, text):
        self.figures.append(text)
        log("  " + text)

    # ---- churn ----

    def churn(self):
        p = self.profile
        log(f"== churn: {p['churn_clients']} clients x {p['churn_messages']} messages "
            f"({p['churn_sessions']} sessions each), kills seeded with {self.args.seed}")
        c = self.checks
        started = time.monotonic()
        bus = Bus(self.new_dir("churn"))
        daemon = self.start_daemon(bus, self.new_dir("churn/state"), "churn")
        index = AnalyticsIndex(daemon.state_dir)
        try:
            warm = self.churn_round(bus, daemon, index, kill_fraction=0.0, label="warm-up")
            rss_before = self.settled_rss(daemon) if p["churn_rss"] else daemon.rss_kib()
            self.figure(f"RSS after the warm-up round, settled: {rss_before} KiB")
            churn = self.churn_round(bus, daemon, index, kill_fraction=p["churn_kill_fraction"],
                                     label="churn")
            rss_at_end = daemon.rss_kib()
            rss_after = self.settled_rss(daemon) if p["churn_rss"] else rss_at_end
            change = 100.0 * (rss_after - rss_before) / rss_before
            self.figure(f"RSS after the churn round: {rss_at_end} KiB at once, {rss_after} KiB "
                        f"settled ({change:+.1f} % of the warm-up level)")
            if p["churn_rss"]:
                c.check(rss_after <= rss_before * 1.10,
                        f"churn: RSS {rss_after} KiB is more than 10 % above {rss_before} KiB")
            stats = daemon.stats()
            self.figure(f"GetStats: clients_max {stats.get('clients_max')}, sessions_max "
                        f"{stats.get('sessions_max')}, sink_lines_lost "
                        f"{stats.get('sink_lines_lost')}")
            c.check(stats.get("sink_lines_lost") == 0,
                    f"churn: sink lines lost: {stats.get('sink_lines_lost')}")
            c.check(daemon.alive(), "churn: the daemon died")
        finally:
            status = daemon.terminate()
            bus.stop()
        check_clean_exit(c, daemon, status, "churn")
        self.figure(f"churn: {warm['clients'] + churn['clients']} clients, "
                    f"{warm['answered'] + churn['answered']} messages answered, "
                    f"{churn['kills']} kills, {time.monotonic() - started:.0f} s")

    def churn_round(self, bus, daemon, index, kill_fraction, label):
        p = self.profile
        c = self.checks
        messages, sessions = p["churn_messages"], p["churn_sessions"]
        progress = max(1, messages // 20)
        started = time.monotonic()
        plan = []  # (client, answered count at which it is killed, or None)
        for _ in range(p["churn_clients"]):
            kill_at = None
            if self.rng.random() < kill_fraction:
                # A whole number of progress steps, so the kill waits for a report that comes.
                kill_at = self.rng.randint(0, 19) * progress
            plan.append([self.client(bus, sessions, messages, progress=progress), kill_at])
        everyone = [client for client, _ in plan]
        killed, replacements = [], []
        deadline = time.monotonic() + 600
        while True:
            for entry in plan:
                client, kill_at = entry
                if kill_at is None or client.killed:
                    continue
                if client.process.poll() is not None:
                    entry[1] = None  # it finished before its turn came
                    continue
                if client.started.is_set() and client.answered >= kill_at:
                    client.kill()
                    killed.append(client)
                    # A new client takes the dead one's place, so the load goes on.
                    fresh = self.client(bus, sessions, messages, progress=progress)
                    replacements.append(fresh)
                    everyone.append(fresh)
            if all(cl.killed or cl.process.poll() is not None for cl in everyone):
                break
            if not daemon.alive():
                break
            if time.monotonic() > deadline:
                raise Failure(f"churn {label}: clients still running after 600 s")
            time.sleep(0.02)
        for cl in everyone:
            status = cl.wait(60)
            if not cl.killed:
                c.check(status == 0 and cl.done_line is not None,
                        f"churn {label}: client {cl.first_id} ended with {status}: "
                        f"{cl.stderr()[-500:]}")
        if not c.check(daemon.alive(), f"churn {label}: the daemon died during the round"):
            raise Failure("the daemon died:\n" + daemon.log_text()[-6000:])

        dead_rids = [rid for cl in killed for rid in cl.rids]
        all_rids = [rid for cl in everyone for rid in cl.rids]
        # Survivors destroy their sessions; the dead ones' sessions end with their connections.
        try:
            wait_until(lambda: not set(daemon.reporters()) & set(all_rids), timeout=60,
                       interval=0.2, what="every session of the round to leave GetAllReporters")
        except AssertionError:
            c.check(False, f"churn {label}: still listed: "
                           f"{sorted(set(daemon.reporters()) & set(all_rids))[:20]}")
        try:
            wait_until(lambda: index.has_summaries(all_rids), timeout=120, interval=0.5,
                       what="a summary of every session")
        except AssertionError:
            missing = [r for r in all_rids if r not in index.summaries]
            c.check(False, f"churn {label}: no summary for {len(missing)} sessions, "
                           f"{len(set(missing) & set(dead_rids))} of them of killed clients: "
                           f"{missing[:10]}")
        index.update()
        answered = 0
        for cl in everyone:
            for rid in cl.rids:
                qv, svc = index.qvsound.get(rid, set()), index.service.get(rid, set())
                count = len(index.summaries.get(rid, []))
                c.check(count == 1 and index.service_summaries.get(rid) == 1,
                        f"churn {label}: session {rid} has {count} summaries")
                c.check(qv == svc, f"churn {label}: session {rid}: the two events of its "
                                   f"messages differ ({len(qv)} and {len(svc)})")
                # Calls are handled in order: what reached the sink is a prefix of what was sent.
                c.check(qv == set(range(len(qv))),
                        f"churn {label}: session {rid}: messages in the sink are not 0..{len(qv)-1}")
                summary = (index.summaries.get(rid) or [{}])[0]
                c.check(summary.get("num_messages", -1) >= len(qv),
                        f"churn {label}: session {rid}: summary counts "
                        f"{summary.get('num_messages')} messages, the sink holds {len(qv)}")
                if not cl.killed:
                    c.check(len(qv) == cl.messages_for(rid),
                            f"churn {label}: session {rid} of a survivor: {len(qv)} of "
                            f"{cl.messages_for(rid)} messages in the sink")
            if not cl.killed:
                mine = cl.answers()
                answered += len(mine)
                c.check(len(mine) == cl.messages,
                        f"churn {label}: client {cl.first_id} was answered {len(mine)} of "
                        f"{cl.messages} calls")
                missing = [(r, s) for r, s, _ in mine if s not in index.qvsound.get(r, ())]
                c.check(not missing, f"churn {label}: answered but not in the sink: {missing[:5]}")
            else:
                answered += sum(len(index.qvsound.get(rid, ())) for rid in cl.rids)
        c.check(index.duplicates == 0, f"churn {label}: {index.duplicates} messages twice in the "
                                       "sink")
        # Every connection that left (killed or not) has its uptime recorded once.
        try:
            wait_until(lambda: len(index.update().uptime) >= self.uptimes_expected + len(everyone),
                       timeout=30, interval=0.5, what="the uptime events")
        except AssertionError:
            pass
        self.uptimes_expected += len(everyone)
        ours = [u for u in index.uptime if u.get("processName") == CLIENT_COMM]
        c.check(len(ours) == self.uptimes_expected,
                f"churn {label}: {len(ours)} client uptime events, {self.uptimes_expected} "
                "connections left")
        c.check(not index.reader.bad, f"churn {label}: unparsable analytics lines: "
                                      f"{index.reader.bad[:3]}")
        self.figure(f"{label}: {len(everyone)} clients ({len(killed)} killed at random, "
                    f"{len(replacements)} replacements), {answered} messages in the sink, "
                    f"{len(all_rids)} sessions stopped, {time.monotonic() - started:.1f} s")
        return dict(clients=len(everyone), kills=len(killed), answered=answered)

    uptimes_expected = 0

    def settled_rss(self, daemon, quiet_seconds=12, timeout=90):
        """The daemon's RSS once it stopped falling: the daemon hands memory back every 5 s,
        so this waits for two of those rounds without a drop of 1 %."""
        samples = []
        deadline = time.monotonic() + timeout
        while time.monotonic() < deadline:
            samples.append((time.monotonic(), daemon.rss_kib()))
            window = [rss for t, rss in samples if t >= samples[-1][0] - quiet_seconds]
            if samples[-1][0] - samples[0][0] >= quiet_seconds and \
                    window[0] - min(window) <= window[0] * 0.01:
                return samples[-1][1]
            time.sleep(1)
        return samples[-1][1]

    # ---- sigterm ----

    def sigterm(self):
        p = self.profile
        for round_ in range(p["sigterm_rounds"]):
            self.sigterm_round(round_)

    def sigterm_round(self, round_):
        p = self.profile
        c = self.checks
        label = f"sigterm {round_ + 1}"
        log(f"== {label}: SIGTERM under load of {p['sigterm_clients']} pipelined clients, "
            f"{p['sigterm_leavers']} clients leaving the bus meanwhile")
        started = time.monotonic()
        bus = Bus(self.new_dir(f"sigterm{round_}"))
        daemon = self.start_daemon(bus, self.new_dir(f"sigterm{round_}/state"), f"sigterm{round_}")
        try:
            senders = [self.client(bus, 2, 10**6, depth=64, progress=200)
                       for _ in range(p["sigterm_clients"])]
            leavers = [self.client(bus, 3, 0, keep_sessions=True)
                       for _ in range(p["sigterm_leavers"])]
            for cl in senders + leavers:
                if not cl.started.wait(60):
                    raise Failure(f"{label}: client {cl.first_id} did not start")
            wait_until(lambda: all(cl.answered >= 400 for cl in senders), timeout=120,
                       what="every sender to be answered a few hundred times")
            time.sleep(self.rng.uniform(0.0, 1.0))
            # The leavers go just before, with, or just after the signal, so their names leave the
            # bus while the daemon stops.
            offset = self.rng.uniform(-0.05, 0.1)
            if offset < 0:
                for cl in leavers:
                    cl.kill()
                time.sleep(-offset)
            signalled = time.monotonic_ns()
            daemon.process.send_signal(signal.SIGTERM)
            if offset >= 0:
                time.sleep(offset)
                for cl in leavers:
                    cl.kill()
        except BaseException:
            daemon.kill()
            bus.stop()
            raise
        status = daemon.terminate()
        stop_seconds = (time.monotonic_ns() - signalled) / 1e9
        for cl in senders + leavers:
            cl.wait(60)
        bus.stop()
        check_clean_exit(c, daemon, status, label)
        index = AnalyticsIndex(daemon.state_dir).update()
        before = after = after_in_sink = 0
        for cl in senders:
            for rid, seq, ns in cl.answers():
                if ns < signalled:
                    before += 1
                    c.check(seq in index.qvsound.get(rid, ()) and seq in index.service.get(rid, ()),
                            f"{label}: message {seq} of session {rid}, answered before the "
                            "signal, is not in the sink with both its events")
                else:
                    after += 1
                    after_in_sink += seq in index.qvsound.get(rid, ())
        for cl in senders + leavers:
            for rid in cl.rids:
                c.check(len(index.summaries.get(rid, [])) == 1,
                        f"{label}: session {rid} has {len(index.summaries.get(rid, []))} "
                        "summaries, not 1")
        c.check(not index.reader.bad, f"{label}: unparsable lines: {index.reader.bad[:3]}")
        c.check(not unparsable_lines(daemon.state_dir),
                f"{label}: unparsable sink lines: {unparsable_lines(daemon.state_dir)[:3]}")
        self.figure(f"{label}: leavers killed {offset * 1000:+.0f} ms from the signal; "
                    f"{before} calls answered before the signal, all checked in the sink; "
                    f"{after} answered after it ({after_in_sink} of them in the sink); "
                    f"exit {status} {stop_seconds:.1f} s after the signal; "
                    f"{time.monotonic() - started:.0f} s in all")

    # ---- sigkill ----

    def sigkill(self):
        p = self.profile
        c = self.checks
        log(f"== sigkill: SIGKILL mid-write under {p['sigkill_clients']} clients, then restarts")
        started = time.monotonic()
        bus = Bus(self.new_dir("sigkill"))
        state = self.new_dir("sigkill/state")
        try:
            # 1: a kill while lines of 4 KiB stream to the sinks; a torn line is likely, not sure.
            daemon = self.start_daemon(bus, state, "sigkill-1")
            clients = [self.client(bus, 1, 10**6, depth=64, padding=4096, progress=100)
                       for _ in range(p["sigkill_clients"])]
            wait_until(lambda: all(cl.answered >= 200 for cl in clients), timeout=120,
                       what="every client to be answered a few hundred times")
            time.sleep(self.rng.uniform(0.0, 0.5))
            daemon.kill()
            for cl in clients:
                cl.wait(60)
            natural = torn_sinks(state)
            self.figure(f"sigkill 1: killed under load; torn sink files: {natural or 'none'}")
            self.restart_and_check(bus, state, "sigkill-2", natural, "sigkill 1")

            # 2: a torn line made certain: half a line appended to every sink file.
            daemon = self.start_daemon(bus, state, "sigkill-3")
            clients = [self.client(bus, 1, 10**6, depth=64, padding=4096, progress=100)
                       for _ in range(2)]
            wait_until(lambda: all(cl.answered >= 100 for cl in clients), timeout=120,
                       what="the clients to be answered")
            daemon.kill()
            for cl in clients:
                cl.wait(60)
            sinks = os.path.join(state, "sinks")
            for name in sorted(os.listdir(sinks)):
                line = whole_lines(os.path.join(sinks, name)).splitlines()[-1]
                with open(os.path.join(sinks, name), "ab") as f:
                    f.write(line[:len(line) // 2])
            made = torn_sinks(state)
            c.check(made == sorted(os.listdir(sinks)), "sigkill 2: the appended halves")
            self.restart_and_check(bus, state, "sigkill-4", made, "sigkill 2")
        finally:
            bus.stop()
        self.figure(f"sigkill: {time.monotonic() - started:.0f} s")

    def restart_and_check(self, bus, state, name, torn, label):
        c = self.checks
        sinks = os.path.join(state, "sinks")
        kept = {n: whole_lines(os.path.join(sinks, n)) for n in os.listdir(sinks)}
        daemon = self.start_daemon(bus, state, name)
        try:
            # The first write after the restart: a session's start (Convo) and one message.
            rid = self.ids(1)
            conn = bus.connect()
            r = dbus.Interface(conn.get_object(BUS_NAME, OBJECT_PATH, introspect=False), INTERFACE)
            r.CreateReportingSession(dbus.Int64(rid))
            r.SetConfiguration(dbus.Dictionary({"HostApplicationDisplayID": f"soak.{rid}"}, signature="sv"), dbus.Int64(rid))
            r.StartReportingSession(dbus.Int64(rid), ignore_reply=True)
            r.SendMessage(dbus.Dictionary({"soak_rid": dbus.Int64(rid), "soak_seq": dbus.Int64(0)},
                                          signature="sv"), dbus.UInt32(4),
                          dbus.UInt16(1), [dbus.Int64(rid)])
            index = AnalyticsIndex(state)
            wait_until(lambda: 0 in index.update().qvsound.get(rid, ()) and
                       0 in index.service.get(rid, ()), timeout=30, what="the first write")
            wait_until(lambda: all(n not in torn_sinks(state) for n in kept), timeout=30,
                       what="every sink written")
            stats = daemon.stats()
            bad = unparsable_lines(state)
            c.check(not bad, f"{label}: after the restart's first write: {bad[:3]}")
            c.check(stats["sink_torn_lines_removed"] == len(torn),
                    f"{label}: sink_torn_lines_removed is {stats['sink_torn_lines_removed']}, "
                    f"{len(torn)} files were torn")
            for n, before in kept.items():
                with open(os.path.join(sinks, n), "rb") as f:
                    c.check(f.read(len(before)) == before,
                            f"{label}: {n} lost whole lines in the repair")
            self.figure(f"{label}: restart removed {stats['sink_torn_lines_removed']} torn "
                        f"line(s) ({', '.join(torn) or 'none torn'}); every line of "
                        f"{len(kept)} sink files parses after the first write")
            conn.close()
        finally:
            status = daemon.terminate()
        check_clean_exit(c, daemon, status, label)

    # ---- faults ----

    def faults(self):
        log("== faults: garbage defaults, a full disk, a read-only state directory")
        started = time.monotonic()
        self.garbage_defaults()
        if self.args.skip_mounts:
            log("  full disk and read-only state directory SKIPPED (--skip-mounts)")
        else:
            self.full_disk()
            self.read_only()
        self.figure(f"faults: {time.monotonic() - started:.0f} s")

    def send_session(self, daemon, rid, count, first_seq=0, padding=0):
        """Sends count messages to a started session; every call must be answered."""
        for seq in range(first_seq, first_seq + count):
            payload = {"soak_rid": dbus.Int64(rid), "soak_seq": dbus.Int64(seq)}
            if padding:
                payload["padding"] = "p" * padding
            daemon.reporting.SendMessage(dbus.Dictionary(payload, signature="sv"), dbus.UInt32(4), dbus.UInt16(1),
                                         [dbus.Int64(rid)], timeout=60)

    def begin_session(self, daemon):
        rid = self.ids(1)
        daemon.reporting.CreateReportingSession(dbus.Int64(rid))
        daemon.reporting.SetConfiguration(dbus.Dictionary({"HostApplicationDisplayID": f"soak.{rid}"}, signature="sv"),
                                          dbus.Int64(rid))
        daemon.reporting.StartReportingSession(dbus.Int64(rid), ignore_reply=True)
        return rid

    def garbage_defaults(self):
        c = self.checks
        bus = Bus(self.new_dir("defaults"))
        state = self.new_dir("defaults/state")
        defaults = os.path.join(state, "defaults")
        os.makedirs(defaults)
        suite = os.path.join(defaults, "com.korvane.qvsound.json")
        with open(suite, "wb") as f:
            f.write(b'{"device_name": "x", ' + self.rng.randbytes(4096))
        with open(os.path.join(defaults, "com.korvane.qvsound.convo.json"), "wb") as f:
            f.write(b"\x00\xff" + self.rng.randbytes(512))
        daemon = self.start_daemon(bus, state, "defaults")
        try:
            rid = self.begin_session(daemon)
            self.send_session(daemon, rid, 20)
            # Each version of the file is read when the suite's change is announced.
            versions = [(b"[" * 200000, "is nested too deeply"),
                        (b"[1, 2, 3]\n", "does not hold a JSON object"),
                        (b'{"device_name": ' + b'"' + b"n" * 100000 + b'"' + b"}", None),
                        (b'{"device_name": 12, "disable_reporting": "maybe"}', None)]
            for seq, (text, said) in enumerate(versions, 20):
                with open(suite + ".new", "wb") as f:
                    f.write(text)
                os.rename(suite + ".new", suite)
                daemon.notify.Post("com.korvane.qvsound.reporting", dbus.UInt64(1))
                self.send_session(daemon, rid, 1, first_seq=seq)
                if said:
                    wait_until(lambda: said in daemon.log_text(), timeout=10,
                               what=f"the log to say the defaults file {said}")
            last = 20 + len(versions)
            index = AnalyticsIndex(state)
            wait_until(lambda: len(index.update().qvsound.get(rid, ())) == last, timeout=30,
                       what="every message in the sink")
            text = daemon.log_text()
            c.check(text.count("com.korvane.qvsound.json is not valid JSON; it reads as empty") == 1,
                    "defaults: the garbage file is not reported once as not valid JSON")
            c.check("com.korvane.qvsound.convo.json is not valid JSON" in text,
                    "defaults: the garbage Convo suite is not reported")
            c.check(daemon.alive(), "defaults: the daemon died")
            self.figure(f"defaults: {len(versions) + 2} garbage or odd versions read and "
                        f"reported; {last} messages answered and in the sink")
        finally:
            status = daemon.terminate()
            bus.stop()
        check_clean_exit(c, daemon, status, "defaults")

    def full_disk(self):
        c = self.checks
        p = self.profile
        bus = Bus(self.new_dir("full"))
        mount = self.new_dir("full/state")
        subprocess.run(["mount", "-t", "tmpfs", "-o", "size=2m", "soak-full", mount], check=True)
        daemon = None
        try:
            # A filler takes all but about 256 KiB, so the sinks fill the rest quickly.
            filler = os.path.join(mount, "filler")
            with open(filler, "wb") as f:
                try:
                    while True:
                        f.write(b"\0" * 65536)
                        f.flush()
                except OSError:
                    pass
            os.truncate(filler, max(0, os.path.getsize(filler) - 256 * 1024))
            daemon = self.start_daemon(bus, mount, "full")
            rid = self.begin_session(daemon)
            sent = 0
            while sent < p["faults_messages"]:
                self.send_session(daemon, rid, 50, first_seq=sent, padding=1024)
                sent += 50
            stats = daemon.stats()
            lost = stats.get("sink_lines_lost_analytics", 0)
            c.check(lost > 0, "full disk: no analytics line counted lost on a full disk")
            c.check("No space left on device" in daemon.log_text(),
                    "full disk: the log does not say the disk is full")
            # Room again: the lines that follow are written.
            os.unlink(filler)
            self.send_session(daemon, rid, 20, first_seq=sent, padding=1024)
            sent += 20
            index = AnalyticsIndex(mount)
            wait_until(lambda: {sent - 1} <= index.update().qvsound.get(rid, set()), timeout=30,
                       what="lines written once there is room")
            wait_until(lambda: "writing to" in daemon.log_text() and "again after" in
                       daemon.log_text(), timeout=10, what="the log to say writing resumed")
            stats = daemon.stats()
            lost = stats.get("sink_lines_lost_analytics", 0)
            written = len(index.qvsound.get(rid, ())) + len(index.service.get(rid, ()))
            # Each message is two lines: every one is either in the file or counted lost.
            c.check(written + lost == 2 * sent,
                    f"full disk: {written} lines written and {lost} counted lost, "
                    f"{2 * sent} sent")
            bad = unparsable_lines(mount)
            c.check(not bad, f"full disk: unparsable sink lines: {bad[:3]}")
            c.check(daemon.alive(), "full disk: the daemon died")
            self.figure(f"full disk: {sent} messages answered; {lost} analytics lines counted "
                        f"lost, {written} written; writing resumed once there was room")
        finally:
            status = daemon.terminate() if daemon else 0
            bus.stop()
            subprocess.run(["umount", mount], check=False)
        if daemon:
            check_clean_exit(c, daemon, status, "full disk")

    def read_only(self):
        c = self.checks
        bus = Bus(self.new_dir("readonly"))
        source = self.new_dir("readonly/source")
        mount = self.new_dir("readonly/state")
        subprocess.run(["mount", "--bind", source, mount], check=True)
        daemon = None
        try:
            # A state directory that was in use, then is only readable.
            daemon = self.start_daemon(bus, mount, "readonly-1")
            rid = self.begin_session(daemon)
            self.send_session(daemon, rid, 5)
            index = AnalyticsIndex(mount)
            wait_until(lambda: len(index.update().qvsound.get(rid, ())) == 5, timeout=30,
                       what="the first messages in the sink")
            status = daemon.terminate()
            check_clean_exit(c, daemon, status, "read-only (its first run)")
            lines_before = whole_lines(os.path.join(mount, "sinks", "analytics.jsonl"))
            subprocess.run(["mount", "-o", "remount,bind,ro", mount], check=True)
            daemon = self.start_daemon(bus, mount, "readonly-2")
            rid = self.begin_session(daemon)
            self.send_session(daemon, rid, 30)
            wait_until(lambda: daemon.stats().get("sink_lines_lost_analytics", 0) >= 60,
                       timeout=30, what="the lost lines counted")
            c.check("Read-only file system" in daemon.log_text(),
                    "read-only: the log does not say the file system is read-only")
            with open(os.path.join(mount, "sinks", "analytics.jsonl"), "rb") as f:
                c.check(f.read() == lines_before, "read-only: the sink changed")
            subprocess.run(["mount", "-o", "remount,bind,rw", mount], check=True)
            self.send_session(daemon, rid, 10, first_seq=30)
            index = AnalyticsIndex(mount)
            wait_until(lambda: set(range(30, 40)) <= index.update().qvsound.get(rid, set()),
                       timeout=30, what="lines written once the directory is writable")
            lost = daemon.stats().get("sink_lines_lost_analytics", 0)
            c.check(lost == 60, f"read-only: {lost} analytics lines counted lost, not 60")
            c.check(not unparsable_lines(mount), "read-only: unparsable sink lines")
            c.check(daemon.alive(), "read-only: the daemon died")
            self.figure(f"read-only: 30 messages answered while read-only, {lost} analytics "
                        "lines counted lost; writing resumed once writable")
        finally:
            status = daemon.terminate() if daemon else 0
            bus.stop()
            subprocess.run(["umount", mount], check=False)
        if daemon:
            check_clean_exit(c, daemon, status, "read-only")

    # ---- floods ----

    def floods(self):
        floods.run(self)

    # ---- all ----

    def run(self, scenarios):
        started = time.monotonic()
        log(f"soak: {'full' if self.args.full else 'short'} form, seed {self.args.seed}, "
            f"daemon {self.args.daemon}, work directory {self.workdir}")
        try:
            for name in scenarios:
                getattr(self, name)()
        except Failure as e:
            self.checks.check(False, str(e))
        log(f"soak: {time.monotonic() - started:.0f} s, "
            f"{len(self.checks.failed)} failed check(s)")
        for line in self.figures:
            log("  " + line)
        if not self.checks.failed and not self.args.keep:
            shutil.rmtree(self.workdir, ignore_errors=True)
        else:
            log(f"soak: logs and state kept in {self.workdir}")
        return not self.checks.failed


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n\n")[0])
    parser.add_argument("--full", action="store_true", help="the long form")
    parser.add_argument("--seed", type=int, default=None, help="seed of the random choices")
    parser.add_argument("--only", default="churn,sigterm,sigkill,faults,floods",
                        help="scenarios to run, comma-separated")
    parser.add_argument("--daemon", default=os.path.join(SOURCE_DIR, "build", "asan-ubsan",
                                                         "qvreportd"))
    parser.add_argument("--client", default=os.path.join(SOURCE_DIR, "build", "asan-ubsan",
                                                         "tests", "qv_soak_client"))
    parser.add_argument("--workdir", default=None, help="where the work directory is made")
    parser.add_argument("--keep", action="store_true", help="keep logs and state directories")
    parser.add_argument("--skip-mounts", action="store_true",
                        help="leave out the full-disk and read-only cases (they need root)")
    args = parser.parse_args()
    if args.seed is None:
        args.seed = random.SystemRandom().randrange(1 << 32)
    scenarios = [s for s in args.only.split(",") if s]
    unknown = set(scenarios) - {"churn", "sigterm", "sigkill", "faults", "floods"}
    if unknown:
        parser.error(f"unknown scenarios: {sorted(unknown)}")
    if "faults" in scenarios and not args.skip_mounts:
        if os.geteuid() != 0:
            parser.error("the full-disk and read-only cases mount file systems: run as root, or "
                         "pass --skip-mounts")
        if os.environ.get("QV_SOAK_MOUNT_NAMESPACE") != "1":
            # In a mount namespace of its own, whatever happens to this run no mount outlives it.
            env = dict(os.environ, QV_SOAK_MOUNT_NAMESPACE="1")
            os.execvpe("unshare", ["unshare", "--mount", "--propagation", "private",
                                   sys.executable, *sys.argv, "--seed", str(args.seed)], env)
    for path in (args.daemon, args.client):
        if not os.access(path, os.X_OK):
            parser.error(f"{path} is not built (scripts/soak builds it)")
    soak = Soak(args, FULL if args.full else SHORT)
    sys.exit(0 if soak.run(scenarios) else 1)


if __name__ == "__main__":
    main()
