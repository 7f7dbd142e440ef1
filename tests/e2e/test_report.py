"""qvreportctl report end to end: a state directory filled through the real daemon by replaying the
examples, the page it writes rendered by headless Chromium and every plot checked for data, both in
the DOM (the SVG gnuplot drew holds data elements) and on the screenshot (colored pixels inside the
plot's box); the summary table; and what a person meets when there is nothing to show."""

import html.parser
import json
import os
import re
import shutil
import subprocess
import tempfile
import unittest

from PIL import Image

from harness import DAEMON, SOURCE_DIR, Bus, Daemon

CTL = os.environ.get("QVREPORTCTL", os.path.join(os.path.dirname(os.path.abspath(DAEMON)),
                                                 "qvreportctl"))
CHROMIUM = shutil.which("chromium")
# Generous: Chromium starts slowly on a machine whose cores are busy building.
TIMEOUT = 120
WIDTH = 1000

PLOTS = ["plot-sessions", "plot-usage-application", "plot-usage-device", "plot-volume",
         "plot-issues"]

# A game whose stream overloads once, beside the examples.
OVERLOAD = "\n".join(json.dumps(line) for line in [
    {"op": "create", "id": 11},
    {"op": "set-type", "id": 11, "type": "nonlongformaudio"},
    {"op": "configure", "id": 11, "config": {"KXHostApplicationDisplayID": "com.example.game"}},
    {"op": "start", "id": 11},
    {"op": "send", "ids": [11], "category": "IO", "type": "Error",
     "payload": {"issue_type": "overload", "smallest_buffer_frame_size": 1024, "io_cycle": 3}},
    {"op": "stop", "id": 11},
    {"op": "destroy", "id": 11},
]) + "\n"

# Added to a copy of the page only: it writes each plot's box (in page pixels) and the page's
# height into the DOM that --dump-dom prints.
BOX_SCRIPT = """<script>
for (const f of document.querySelectorAll('figure.plot')) {
  const r = f.getBoundingClientRect();
  f.dataset.box = [r.left, r.top + window.scrollY, r.width, r.height].map(Math.round).join(',');
}
document.body.dataset.height = document.documentElement.scrollHeight;
</script>"""


class SeriesCounter(html.parser.HTMLParser):
    """What each gnuplot series (a group "<plot>-gnuplot_plot_N") draws beyond its key sample:
    line segments, filled polygons and point symbols. A series with a title has one of them in
    the key (its text marks it)."""

    def __init__(self):
        super().__init__()
        self.stack = []  # (tag, the series it opens or None)
        self.shapes = {}
        self.keyed = set()

    def series(self):
        inside = [s for _, s in self.stack if s]
        return inside[-1] if inside else None

    def handle_starttag(self, tag, attrs):
        attrs = dict(attrs)
        opens = None
        if tag == "g" and re.fullmatch(r"[a-z-]+-gnuplot_plot_\d+", attrs.get("id", "")):
            opens = attrs["id"]
            self.shapes[opens] = 0
        self.stack.append((tag, opens))
        series = self.series()
        if series is None:
            return
        if tag == "path":
            self.shapes[series] += len(re.findall(r"[LlVvHh]", attrs.get("d", "")))
        elif tag == "use" or (tag == "polygon" and attrs.get("points")):
            self.shapes[series] += 1

    def handle_data(self, data):
        if data.strip() and self.stack and self.stack[-1][0] == "text" and self.series():
            self.keyed.add(self.series())

    def handle_endtag(self, tag):
        while self.stack:
            if self.stack.pop()[0] == tag:
                break

    def data_shapes(self):
        return {s: n - (s in self.keyed) for s, n in self.shapes.items()}


class Report(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        if not CHROMIUM:
            raise AssertionError("chromium is not installed (scripts/setup installs it)")
        cls.workdir = tempfile.mkdtemp(prefix="qv-e2e-report-")
        cls.bus = Bus(cls.workdir)
        device = os.path.join(cls.workdir, "device.json")
        with open(device, "w") as f:
            json.dump({"InternalBuild": True, "capabilities": {"haptics": True}}, f)
        cls.state = os.path.join(cls.workdir, "state")
        os.makedirs(cls.state)
        daemon = Daemon(cls.bus, cls.state, "--device-file", device)
        try:
            for example in ["playback", "recording", "haptics", "haptics-leak"]:
                cls.ctl("replay", os.path.join(SOURCE_DIR, "examples", example + ".jsonl"))
            cls.ctl("replay", "-", input=OVERLOAD)
            # While the daemon runs, the counters are its own.
            cls.ctl("report", "-o", cls.path("live.html"))
        finally:
            daemon.stop()
        cls.ctl("report", "-o", cls.path("report.html"))

    @classmethod
    def tearDownClass(cls):
        cls.bus.stop()
        shutil.rmtree(cls.workdir, ignore_errors=True)

    @classmethod
    def path(cls, name):
        return os.path.join(cls.workdir, name)

    @classmethod
    def ctl(cls, *args, input=None, env=None, state=None, check=True):
        done = subprocess.run([CTL, "--bus", cls.bus.address, "--state-dir", state or cls.state,
                               *args], input=input, env=env, capture_output=True, text=True,
                              timeout=TIMEOUT, cwd=cls.workdir)
        if check and done.returncode != 0:
            raise AssertionError(f"qvreportctl {' '.join(args)}: {done.returncode} {done.stderr}")
        return done

    def chromium(self, page, *args):
        done = subprocess.run(
            [CHROMIUM, "--headless", "--no-sandbox", "--disable-gpu", "--hide-scrollbars",
             "--no-first-run", f"--user-data-dir={self.path('chromium')}", *args,
             "file://" + page],
            capture_output=True, text=True, timeout=TIMEOUT)
        self.assertEqual(done.returncode, 0, done.stderr[-2000:])
        return done.stdout

    def read(self, name):
        with open(self.path(name)) as f:
            return f.read()

    def test_every_plot_has_data_in_the_dom_and_on_the_screenshot(self):
        page = self.read("report.html")
        with open(self.path("boxed.html"), "w") as f:
            f.write(page.replace("</body>", BOX_SCRIPT + "</body>"))
        dom = self.chromium(self.path("boxed.html"), f"--window-size={WIDTH},1000", "--dump-dom")

        figures = {m.group(1): m for m in re.finditer(
            r'<figure class="plot" id="([a-z-]+)" data-points="(\d+)" data-box="([\d,-]+)">'
            r'(.*?)</figure>', dom, re.S)}
        self.assertEqual(sorted(figures), sorted(PLOTS), "a plot is missing or empty")
        points = {name: int(m.group(2)) for name, m in figures.items()}
        # Five sessions (four examples and the game), two applications that played or recorded
        # on three devices, the playback example's five stretches, and one issue of each kind.
        self.assertEqual(points, {"plot-sessions": 5, "plot-usage-application": 2,
                                  "plot-usage-device": 3, "plot-volume": 5, "plot-issues": 3})
        for name, m in figures.items():
            counter = SeriesCounter()
            counter.feed(m.group(4))
            self.assertTrue(counter.shapes, f"{name}: no series")
            for series, shapes in counter.data_shapes().items():
                self.assertGreater(shapes, 0, f"{series} draws nothing but its key")
        for kind in ["MTX record (1)", "capture (1)", "overload (1)"]:
            self.assertIn(kind, figures["plot-issues"].group(4))

        height = int(re.search(r'<body data-height="(\d+)"', dom).group(1))
        shot = self.path("report.png")
        self.chromium(self.path("report.html"), f"--window-size={WIDTH},{height}",
                      f"--screenshot={shot}")
        image = Image.open(shot).convert("RGB")
        for name, m in figures.items():
            left, top, width, height = (int(v) for v in m.group(3).split(","))
            self.assertGreater(width * height, 0, name)
            # The graph's area: every key is below it. Axes and text are black or grey; the data
            # is drawn in color.
            box = image.crop((left, top, left + width, top + height * 8 // 10))
            colored = sum(1 for r, g, b in box.getdata() if max(r, g, b) - min(r, g, b) > 80)
            self.assertGreater(colored, 20, f"{name}: no data drawn on the screenshot")

    def test_the_page_holds_all_it_shows_under_ids_that_never_collide(self):
        page = self.read("report.html")
        # Each plot's inline SVG keeps its own ids apart from the others'.
        ids = [m.group(2) for m in re.finditer(r"""\bid=(["'])(.*?)\1""", page)]
        self.assertEqual(len(ids), len(set(ids)), "an id used twice")
        self.assertIn("plot-volume-gnuplot_plot_1", ids)
        for outside in ("<?xml", "src=", 'href="http'):
            self.assertNotIn(outside, page)

    def test_counters_come_from_getstats_while_the_daemon_runs_else_from_disk(self):
        live = self.read("live.html")
        self.assertIn("From GetStats of the daemon on the bus", live)
        self.assertRegex(live, r"<td>sessions_max</td><td class=\"n\">[1-9]")
        after = self.read("report.html")
        self.assertIn("From the files on disk: no daemon runs on the bus", after)
        self.assertRegex(after, r"<td>analytics</td><td class=\"n\">1</td>")

    def test_summary_lists_each_session_in_aligned_columns(self):
        lines = self.ctl("report", "--summary").stdout.splitlines()
        self.assertEqual(len(lines), 6, lines)
        header, rows = lines[0], lines[1:]
        column = header.index("APPLICATION")
        self.assertEqual([row[column:].split()[0] for row in rows],
                         ["com.example.music", "com.example.recorder", "com.example.racer",
                          "com.example.haptics", "com.example.game"])
        for app, derived, issues in [("music", "volume stretch x5", "-"),
                                     ("recorder", "input stretch x2", "-"),
                                     ("racer", "summary", "silence"),
                                     ("haptics", "summary", "capture"),
                                     ("game", "summary", "overload")]:
            row = next(r for r in rows if f"com.example.{app} " in r)
            self.assertIn(derived, row[header.index("DERIVED"):])
            self.assertEqual(row[header.index("ISSUES"):], issues)
        one = self.ctl("--json", "report", "--summary", "--app", "com.example.music").stdout
        sessions = [json.loads(line) for line in one.splitlines()]
        self.assertEqual([(s["application"], s["derived"]["volume stretch"]) for s in sessions],
                         [("com.example.music", 5)])

    def test_nothing_to_show_and_the_errors_people_meet(self):
        empty = self.ctl("report", "--since", "2000-01-01", "--until", "2000-01-02T00:00Z",
                         "-o", self.path("empty.html"))
        self.assertIn("no data in this range", empty.stderr)
        page = self.read("empty.html")
        self.assertIn('id="no-data"', page)
        self.assertEqual(page.count('data-points="0"'), len(PLOTS))
        self.assertNotIn("<svg", page)

        cases = [
            (["report", "--since", "yesterday"], None, None, 2, "not a time"),
            (["report", "--since", "2026-01-02", "--until", "2026-01-01"], None, None, 2,
             "--since must come before --until"),
            (["report"], None, self.path("nowhere"), 1, "no state directory"),
            # Without gnuplot on PATH: the package to install is named.
            (["report", "-o", self.path("never.html")], {"PATH": self.workdir}, None, 1,
             "gnuplot-nox"),
        ]
        for args, env, state, status, message in cases:
            done = self.ctl(*args, env=env, state=state, check=False)
            self.assertEqual(done.returncode, status, (args, done.stderr))
            self.assertIn(message, done.stderr, args)
        self.assertFalse(os.path.exists(self.path("never.html")))


if __name__ == "__main__":
    unittest.main()
