"""Real nats-server processes on free loopback ports (one node, or a three-node JetStream
cluster), qvreport-export runs, sink files written the way the daemon writes them, and the
stream read back with `qvreportctl fleet tail` to be compared with the files."""

import json
import os
import signal
import socket
import subprocess
import time
import urllib.request

from harness import wait_until

EXPORTER = os.environ.get("QVREPORT_EXPORT", "qvreport-export")
CTL = os.environ.get("QVREPORTCTL", "qvreportctl")


def nkey_pair():
    """A user's nkey (public key, seed) as the NATS tools write them: the ed25519 key with its
    prefix byte and CRC-16 (XMODEM, little end first), in base32 without padding."""
    import base64
    from cryptography.hazmat.primitives import serialization
    from cryptography.hazmat.primitives.asymmetric.ed25519 import Ed25519PrivateKey

    def crc16(data):
        crc = 0
        for byte in data:
            crc ^= byte << 8
            for _ in range(8):
                crc = ((crc << 1) ^ 0x1021 if crc & 0x8000 else crc << 1) & 0xFFFF
        return crc

    def encode(raw):
        crc = crc16(raw)
        return base64.b32encode(raw + bytes([crc & 0xFF, crc >> 8])).decode().rstrip("=")

    seed = os.urandom(32)
    public = Ed25519PrivateKey.from_private_bytes(seed).public_key().public_bytes(
        serialization.Encoding.Raw, serialization.PublicFormat.Raw)
    user, seed_prefix = 20 << 3, 18 << 3
    return (encode(bytes([user]) + public),
            encode(bytes([seed_prefix | user >> 5, (user & 31) << 3]) + seed))


def free_port():
    with socket.socket() as s:
        s.bind(("127.0.0.1", 0))
        return s.getsockname()[1]


class NatsServer:
    """One nats-server with JetStream, started and stopped by PID; its store survives restarts."""

    def __init__(self, workdir, name, cluster_port=None, routes=(), extra_config=""):
        self.workdir = workdir
        self.name = name
        self.port = free_port()
        self.http_port = free_port()
        self.cluster_port = cluster_port
        self.routes = list(routes)
        self.extra_config = extra_config
        self.config = os.path.join(workdir, f"{name}.conf")
        self.log = os.path.join(workdir, f"{name}.log")
        self.proc = None
        with open(self.config, "w") as f:
            f.write(self._config())

    def _config(self):
        store = os.path.join(self.workdir, f"{self.name}-store")
        text = (f"server_name: {self.name}\nlisten: 127.0.0.1:{self.port}\n"
                f"http: 127.0.0.1:{self.http_port}\n"
                f"jetstream {{ store_dir: \"{store}\", max_memory_store: 64MB, "
                f"max_file_store: 2GB }}\n")
        if self.cluster_port:
            routes = ", ".join(f"nats://127.0.0.1:{p}" for p in self.routes)
            text += (f"cluster {{ name: qvtest, listen: 127.0.0.1:{self.cluster_port}, "
                     f"routes: [{routes}] }}\n")
        return text + self.extra_config

    @property
    def url(self):
        return f"nats://127.0.0.1:{self.port}"

    def start(self):
        with open(self.log, "a") as log:
            self.proc = subprocess.Popen(["nats-server", "-c", self.config], stdout=log,
                                         stderr=subprocess.STDOUT)
        wait_until(self.healthy, timeout=30, interval=0.1, what=f"{self.name} to listen")

    def monitor(self, path):
        with urllib.request.urlopen(f"http://127.0.0.1:{self.http_port}{path}", timeout=5) as r:
            return json.load(r)

    def healthy(self):
        if self.proc.poll() is not None:
            raise AssertionError(f"nats-server {self.name} exited; see {self.log}")
        try:
            self.monitor("/varz")
            return True
        except OSError:
            return False

    def stop(self, sig=signal.SIGTERM):
        if self.proc and self.proc.poll() is None:
            self.proc.send_signal(sig)
            try:
                self.proc.wait(timeout=30)
            except subprocess.TimeoutExpired:
                self.proc.kill()
                self.proc.wait()
        self.proc = None

    def stream_detail(self, stream):
        try:
            jsz = self.monitor("/jsz?streams=true")
        except OSError:
            return None
        for account in jsz.get("account_details", []):
            for detail in account.get("stream_detail", []):
                if detail.get("name") == stream:
                    return detail
        return None

    def stream_messages(self, stream):
        return ((self.stream_detail(stream) or {}).get("state") or {}).get("messages", 0)

    def stream_leader(self, stream):
        """The server name of the stream's leader as this node sees it, or None."""
        return ((self.stream_detail(stream) or {}).get("cluster") or {}).get("leader")


class Cluster:
    """Three JetStream nodes routed to each other on loopback."""

    def __init__(self, workdir):
        ports = [free_port() for _ in range(3)]
        self.nodes = [NatsServer(workdir, f"n{i + 1}", ports[i], [p for p in ports if p != ports[i]])
                      for i in range(3)]

    @property
    def urls(self):
        return ",".join(n.url for n in self.nodes)

    def start(self):
        for node in self.nodes:
            node.proc = None
        # All three start before any is waited on: a lone node cannot form the meta group.
        for node in self.nodes:
            with open(node.log, "a") as log:
                node.proc = subprocess.Popen(["nats-server", "-c", node.config], stdout=log,
                                             stderr=subprocess.STDOUT)
        for node in self.nodes:
            wait_until(node.healthy, timeout=30, interval=0.1, what=f"{node.name} to listen")

    def stop(self, sig=signal.SIGTERM):
        for node in self.nodes:
            node.stop(sig)

    def node(self, name):
        return next(n for n in self.nodes if n.name == name)

    def leader(self, stream):
        for node in self.nodes:
            if node.proc:
                leader = node.stream_leader(stream)
                if leader:
                    return leader
        return None


class SinkFiles:
    """Writes one sink as the daemon does: whole lines {"time", "seq", ...}, a current segment
    NAME.jsonl renamed to NAME.SEQ.jsonl when it rotates, the oldest closed ones deleted."""

    def __init__(self, state_dir, sink, pad=40):
        self.dir = os.path.join(state_dir, "sinks")
        os.makedirs(self.dir, exist_ok=True)
        self.sink = sink
        self.seq = 0
        self.first_of_current = 1
        self.pad = "x" * pad

    @property
    def current(self):
        return os.path.join(self.dir, f"{self.sink}.jsonl")

    def append(self, count):
        """Appends count lines, each with one write of its own, as the daemon does."""
        fd = os.open(self.current, os.O_WRONLY | os.O_APPEND | os.O_CREAT, 0o644)
        try:
            for _ in range(count):
                self.seq += 1
                os.write(fd, (json.dumps({"time": time.time(), "seq": self.seq, "event": "e",
                                          "payload": {"n": self.seq, "pad": self.pad}},
                                         separators=(",", ":")) + "\n").encode())
        finally:
            os.close(fd)

    def rotate(self):
        os.rename(self.current, os.path.join(self.dir, f"{self.sink}.{self.first_of_current:012d}.jsonl"))
        self.first_of_current = self.seq + 1

    def closed_segments(self):
        prefix = self.sink + "."
        return sorted(n for n in os.listdir(self.dir)
                      if n.startswith(prefix) and n.endswith(".jsonl") and n != f"{self.sink}.jsonl"
                      and n[len(prefix):-6].isdigit())

    def expire_oldest(self):
        """Deletes the oldest closed segment; returns how many lines it held."""
        path = os.path.join(self.dir, self.closed_segments()[0])
        with open(path) as f:
            count = sum(1 for _ in f)
        os.unlink(path)
        return count


def file_lines(state_dir, sink):
    """(seq, object) of every whole line of a sink's segments, in seq order."""
    directory = os.path.join(state_dir, "sinks")
    prefix = sink + "."
    names = sorted(n for n in os.listdir(directory) if n.startswith(prefix) and n.endswith(".jsonl")
                   and n[len(prefix):-6].isdigit())
    if os.path.exists(os.path.join(directory, sink + ".jsonl")):
        names.append(sink + ".jsonl")
    lines = []
    for name in names:
        with open(os.path.join(directory, name)) as f:
            for line in f:
                if line.endswith("\n"):
                    obj = json.loads(line)
                    lines.append((obj["seq"], obj))
    return lines


class Exporter:
    def __init__(self, workdir, state_dir, urls, *extra, name="exporter"):
        self.state_dir = state_dir
        self.log_path = os.path.join(workdir, f"{name}.log")
        self.args = [EXPORTER, "--state-dir", state_dir, "--nats-url", urls, *extra]
        self.proc = None

    def start(self):
        with open(self.log_path, "a") as log:
            self.proc = subprocess.Popen(self.args, stdout=log, stderr=subprocess.STDOUT)
        return self

    def stop(self, sig=signal.SIGTERM):
        if self.proc and self.proc.poll() is None:
            self.proc.send_signal(sig)
            self.proc.wait(timeout=30)
        code = self.proc.returncode if self.proc else None
        self.proc = None
        # Under the sanitizer presets a report fails the test that caused it.
        log = self.log() if os.path.exists(self.log_path) else ""
        if "Sanitizer" in log or "runtime error:" in log:
            raise AssertionError(f"sanitizer report from qvreport-export:\n{log}")
        return code

    def log(self):
        with open(self.log_path) as f:
            return f.read()

    def _read(self, name):
        try:
            with open(os.path.join(self.state_dir, "export", name)) as f:
                return json.load(f)
        except (OSError, ValueError):
            return None

    def status(self):
        return self._read("status.json")

    def cursor(self):
        return (self._read("cursor.json") or {}).get("sinks", {})

    def caught_up(self, expected):
        """True once the cursor holds every sink's expected last seq ({sink: seq})."""
        if self.proc and self.proc.poll() is not None:
            raise AssertionError(f"qvreport-export exited ({self.proc.returncode}):\n{self.log()}")
        cursor = self.cursor()
        return all(cursor.get(sink, 0) >= seq for sink, seq in expected.items())


    def wait_caught_up(self, expected, timeout=60):
        try:
            wait_until(lambda: self.caught_up(expected), timeout=timeout, interval=0.1,
                       what=f"the cursor to reach {expected}")
        except AssertionError as e:
            raise AssertionError(f"{e}; status {self.status()}; log:\n{self.log()}") from None


def ctl(*args, timeout=120):
    done = subprocess.run([CTL, *args], capture_output=True, text=True, timeout=timeout)
    if done.returncode != 0:
        raise AssertionError(f"qvreportctl {' '.join(args)} failed ({done.returncode}): {done.stderr}")
    return done.stdout


def stream_lines(urls, *extra, timeout=90):
    """{(device, sink): [(seq, object without device and sink)]} in stream order."""
    # After every server restarts, the stream takes writes before the cluster's meta leader is
    # settled, and making a reader's consumer times out, or is refused as JetStream being
    # temporarily unavailable, until it is: read again then.
    unsettled = ("Timeout", "temporarily unavailable")
    deadline = time.monotonic() + timeout
    while True:
        try:
            text = ctl("--json", "fleet", "tail", "--nats-url", urls, *extra)
            break
        except AssertionError as e:
            if not any(s in str(e) for s in unsettled) or time.monotonic() > deadline:
                raise
            time.sleep(1)
    out = {}
    for line in text.splitlines():
        obj = json.loads(line)
        key = (obj.pop("device"), obj.pop("sink"))
        out.setdefault(key, []).append((obj["seq"], obj))
    return out


class StreamComparison:
    """What the stream holds of one device's sinks next to what the files hold."""

    def __init__(self, urls, state_dir, sinks, settle=0):
        """settle: for how many seconds to read the stream again while lines on disk are missing
        from it. Right after a leader change a reader can be served by a replica still catching
        up, which holds a prefix of the stream; a line really lost stays missing."""
        deadline = time.monotonic() + settle
        while True:
            streams = stream_lines(urls)
            self.devices = {device for device, _ in streams}
            self.by_sink = {sink: ([line for (_, name), lines in streams.items() if name == sink
                                    for line in lines], file_lines(state_dir, sink))
                            for sink in sinks}
            if not self.missing() or time.monotonic() > deadline:
                return
            time.sleep(2)

    def missing(self):
        """{sink: seqs on disk not in the stream} for the sinks that miss any."""
        missing = {}
        for sink, (in_stream, on_disk) in self.by_sink.items():
            seqs = sorted({seq for seq, _ in on_disk} - {seq for seq, _ in in_stream})
            if seqs:
                missing[sink] = seqs
        return missing

    def check(self, test):
        """Each line on disk is in the stream exactly once, in seq order, equal to the file's."""
        for sink, (in_stream, on_disk) in self.by_sink.items():
            seqs = [seq for seq, _ in in_stream]
            test.assertEqual(len(seqs), len(set(seqs)), f"{sink}: a line is in the stream twice")
            test.assertEqual(seqs, sorted(seqs), f"{sink}: the stream is out of seq order")
            disk = dict(on_disk)
            stream = dict(in_stream)
            missing = self.missing().get(sink, [])
            test.assertEqual(missing[:10], [], f"{sink}: {len(missing)} lines on disk not in the "
                             f"stream, which holds {len(stream)} (up to seq {max(stream, default=0)})")
            for seq, obj in disk.items():
                test.assertEqual(stream[seq], obj, f"{sink}: line {seq} differs")
        return sum(len(s) for s, _ in self.by_sink.values())
