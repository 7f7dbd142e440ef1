"""qvreportctl's bash completion, driven in a real bash as the shell drives it on <Tab>: the
function is sourced from the file that is installed, COMP_WORDS and COMP_CWORD are set, and
COMPREPLY is read back."""

import os
import shutil
import subprocess
import tempfile
import unittest

SOURCE_DIR = os.environ["QV_SOURCE_DIR"]
CTL = os.environ["QVREPORTCTL"]
SCRIPT = os.path.join(SOURCE_DIR, "client", "completion", "qvreportctl.bash")


class Completion(unittest.TestCase):
    def setUp(self):
        self.state = tempfile.mkdtemp(prefix="qv-completion-")
        sinks = os.path.join(self.state, "sinks")
        defaults = os.path.join(self.state, "defaults")
        os.makedirs(sinks)
        os.makedirs(defaults)
        # A sink with only closed segments left counts as much as one with a current file.
        for name in ("analytics.jsonl", "analytics.000000000001.jsonl",
                     "mtx.000000000007.jsonl", "convo.jsonl"):
            open(os.path.join(sinks, name), "w").close()
        for name in ("com.korvane.qvsound.convo.json", "com.korvane.qvsound.issuecapture.json"):
            open(os.path.join(defaults, name), "w").close()

    def tearDown(self):
        shutil.rmtree(self.state, ignore_errors=True)

    def complete(self, *words):
        """COMPREPLY for the command line qvreportctl WORDS..., the cursor in the last word."""
        line = [CTL, *words]
        program = (f"source {SCRIPT}\n"
                   "COMP_WORDS=(\"$@\"); COMP_CWORD=$(( $# - 1 ))\n"
                   "_qvreportctl\n"
                   "printf '%s\\n' \"${COMPREPLY[@]}\"\n")
        done = subprocess.run(["bash", "-c", program, "bash", *line], capture_output=True,
                              text=True, timeout=30, check=True)
        return [l for l in done.stdout.splitlines() if l]

    def test_completes_commands_options_and_names(self):
        state = ["--state-dir", self.state]
        cases = [
            # (words, what must be offered, what must not)
            ([""], {"create", "replay", "defaults", "sinks", "stats", "notify"}, {"read"}),
            (["s"], {"set-type", "start", "send", "stop", "stats", "sinks"}, {"create"}),
            (["--j"], {"--json"}, {"--bus"}),
            (["defaults", ""], {"read", "write", "delete"}, {"create"}),
            (["sinks", "--f"], {"--follow"}, set()),
            # Global options come after a command too.
            (["sinks", "--b"], {"--bus"}, set()),
            (["--bus", ""], {"system", "session"}, {"create"}),
            ([*state, "sinks", ""], {"analytics", "mtx", "convo"}, {"create", "analytics.jsonl"}),
            ([*state, "sinks", "m"], {"mtx"}, {"analytics"}),
            # bash splits "--state-dir=DIR" into three words.
            (["sinks", "--state-dir", "=", self.state, "a"], {"analytics"}, set()),
            (["--bus", "=", "s"], {"system", "session"}, set()),
            ([*state, "defaults", "write", "com.korvane.qvsound.i"],
             {"com.korvane.qvsound.issuecapture"}, {"com.korvane.qvsound.convo"}),
            # The suite is the first argument only; a key is free text.
            ([*state, "defaults", "write", "com.korvane.qvsound.convo", ""], set(),
             {"com.korvane.qvsound.convo"}),
            # A reporter ID has no candidates.
            (["stop", ""], set(), {"create", "stop"}),
        ]
        for words, offered, withheld in cases:
            with self.subTest(words=words):
                reply = set(self.complete(*words))
                self.assertLessEqual(offered, reply)
                self.assertFalse(withheld & reply, f"offered {withheld & reply}")

    def test_files_and_directories_come_from_the_shell(self):
        script = os.path.join(self.state, "session.jsonl")
        open(script, "w").close()
        self.assertEqual(self.complete("replay", os.path.join(self.state, "sess")), [script])
        self.assertEqual(self.complete("--state-dir", os.path.join(self.state, "si")),
                         [os.path.join(self.state, "sinks")])


if __name__ == "__main__":
    unittest.main()
