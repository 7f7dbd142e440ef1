"""The man pages against the programs they describe: every option each program's --help prints
(every qvreportctl command's too) is an entry of its page with the default --help gives, and
every counter a real daemon's GetStats answers is in qvreporting-files(5)."""

import os
import re
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(__file__), "..", "e2e"))
import harness  # noqa: E402

MAN_DIR = os.environ["QV_MAN_DIR"]
PROGRAMS = {  # program: its page
    os.environ["QVREPORTD"]: "qvreportd.8",
    os.environ["QVREPORTCTL"]: "qvreportctl.1",
    os.environ.get("QVREPORT_EXPORT", ""): "qvreport-export.8",
    os.environ.get("QVREPORT_PIPEWIRE", ""): "qvreport-pipewire.1",
}

# "  -f,--follow   ..." or "  --bus TEXT=system  ..." at the start of a --help line.
OPTION_LINE = re.compile(r"^  ((?:-\w,)?--?[\w-]+)(?: (.+?))?(?:  |$)")


def roff_lines(page):
    """The page's roff lines, font escapes kept, other escapes undone."""
    with open(os.path.join(MAN_DIR, page)) as f:
        text = f.read()
    return [line.replace("\\&", "").replace("\\-", "-").replace("\\e", "\\")
            for line in text.splitlines()]


def terms(line):
    """The bold words a line starts with: "-f", "--follow" of "\\fB-f\\fR, \\fB--follow\\fR"."""
    leading = re.match(r"^(?:\\fB[^\\]*\\fR[A-Z]*,? ?)+", line)
    return re.findall(r"\\fB([^\\]*)\\fR", leading.group(0)) if leading else []


def entry(lines, term):
    """The text of the page's entry whose term line starts with term in bold, or None."""
    for i, line in enumerate(lines):
        if term in terms(line):
            body = []
            for following in lines[i + 1:]:
                if following == ".RE":
                    break
                body.append(following)
            return re.sub(r"\\f[BIR]", "", "\n".join([line] + body))
    return None


def help_text(program, *command):
    done = subprocess.run([program, *command, "--help"], capture_output=True, text=True,
                          timeout=30)
    return done.stdout


def options(help_output):
    """(names, default or None) of every option a --help output lists."""
    found = []
    for line in help_output.splitlines():
        match = OPTION_LINE.match(line)
        if match:
            names = match.group(1).split(",")
            kind = match.group(2) or ""
            default = kind.rsplit("=", 1)[1] if "=" in kind else None
            found.append((names, default))
    return found


def subcommands(help_output):
    section = help_output.split("Subcommands:\n", 1)
    if len(section) < 2:
        return []
    return [line.split()[0] for line in section[1].splitlines() if line.startswith("  ")]


class ManPages(unittest.TestCase):
    def check_options(self, lines, page, help_output, where):
        for names, default in options(help_output):
            for name in names:
                body = entry(lines, name)
                self.assertIsNotNone(body, f"{page}: no entry for {name} ({where})")
                if default is not None:
                    self.assertIn(default, body, f"{page}: {name} does not say its default")

    def test_every_option_is_documented(self):
        for program, page in PROGRAMS.items():
            if not program:
                continue
            lines = roff_lines(page)
            self.check_options(lines, page, help_text(program), os.path.basename(program))

    def test_every_qvreportctl_command_is_documented(self):
        ctl = os.environ["QVREPORTCTL"]
        lines = roff_lines("qvreportctl.1")
        pending = [[name] for name in subcommands(help_text(ctl))]
        self.assertIn(["sinks"], pending)
        seen = 0
        while pending:
            path = pending.pop()
            output = help_text(ctl, *path)
            children = subcommands(output)
            pending += [path + [child] for child in children]
            if not children:
                seen += 1
                self.assertIsNotNone(entry(lines, " ".join(path)),
                                     f"qvreportctl.1: no entry for {path}")
                self.check_options(lines, "qvreportctl.1", output, " ".join(path))
        self.assertGreater(seen, 20)

    def test_every_counter_is_documented(self):
        documented = {term for line in roff_lines("qvreporting-files.5") for term in terms(line)}
        workdir = harness.tempfile.mkdtemp(prefix="qv-man-")
        bus = harness.Bus(workdir)
        state = os.path.join(workdir, "state")
        os.makedirs(state)
        daemon = harness.Daemon(bus, state)
        try:
            stats = harness.Client(bus).stats.GetStats()
        finally:
            daemon.stop()
            bus.stop()
            harness.shutil.rmtree(workdir, ignore_errors=True)
        self.assertIn("limits_exceeded", stats)
        for name in stats:
            self.assertTrue(name in documented, f"counter {name} is not documented")
        # Families appear once a value is met: their prefixes are taken from the counters' source.
        with open(os.path.join(harness.SOURCE_DIR, "src", "session", "QVReportingStats.cpp")) as f:
            prefixes = set(re.findall(r'"([a-z]+(?:_[a-z]+)*_)"', f.read()))
        self.assertIn("sink_lines_lost_", prefixes)
        for prefix in prefixes:
            self.assertTrue(any(term.startswith(prefix) for term in documented),
                            f"counter family {prefix}... is not documented")

if __name__ == "__main__":
    unittest.main()
