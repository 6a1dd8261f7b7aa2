#!/usr/bin/env python3
"""Tests of check_includes, check_kept and limits on small trees of their own."""

import pathlib
import subprocess
import sys
import tempfile
import unittest

SCRIPTS = pathlib.Path(__file__).resolve().parent


class CheckTest(unittest.TestCase):
    script = ""

    def setUp(self):
        self.directory = tempfile.TemporaryDirectory()
        self.addCleanup(self.directory.cleanup)
        self.root = pathlib.Path(self.directory.name)

    def write(self, path, text):
        target = self.root / path
        target.parent.mkdir(parents=True, exist_ok=True)
        target.write_text(text, encoding="utf-8")

    def run_script(self, *arguments):
        return subprocess.run(
            [sys.executable, SCRIPTS / self.script, "--root", self.root, *arguments],
            capture_output=True, text=True, check=False)

    def assert_fine(self, *arguments):
        done = self.run_script(*arguments)
        self.assertEqual((done.returncode, done.stderr), (0, ""))

    def assert_fault(self, text, *arguments):
        done = self.run_script(*arguments)
        self.assertEqual(done.returncode, 1)
        self.assertIn(text, done.stderr)


class CheckIncludes(CheckTest):
    script = "check_includes"

    def test_takes_what_points_down(self):
        self.write("Statistics/A.cpp", '#include "Statistics/A.h"\n'
                   '#include <vector>\n#include "platform/Value.h"\n')
        self.write("platform/Value.h", "#include <string>\n")
        self.write("platform/linux/B.cpp", "#include <unistd.h>\n")
        self.assert_fine()

    def test_refuses_what_the_core_must_not_know(self):
        for include in ("<unistd.h>", "<sqlite3.h>", '"platform/linux/Places.h"',
                        '"platform/fake/ManualClock.h"', "<gtest/gtest.h>",
                        '"client/ServiceConnection.h"', "MACRO"):
            self.write("Statistics/Service/A.cpp", f"#include {include}\n")
            self.assert_fault("Statistics/Service/A.cpp:1: the core must not include "
                              + include)

    def test_lets_tests_and_fixtures_use_the_fakes(self):
        text = '#include <gtest/gtest.h>\n#include "platform/fake/EventLog.h"\n'
        self.write("Statistics/ATest.cpp", text)
        self.write("Statistics/CoreTestFixture.h", text)
        self.assert_fine()
        self.write("Statistics/ATest.cpp", '#include "platform/linux/Places.h"\n')
        self.assert_fault("the core must not include")

    def test_refuses_roles_that_look_up(self):
        self.write("platform/Value.h", '#include "platform/linux/Places.h"\n')
        self.assert_fault("platform/Value.h:1: the roles must not include")

    def test_lets_other_tests_use_what_they_like(self):
        self.write("platform/ValueTest.cpp", "#include <pthread.h>\n")
        self.assert_fine()

    def test_refuses_fakes_that_know_a_binding(self):
        self.write("platform/fake/A.cpp", '#include "platform/linux/Places.h"\n')
        self.assert_fault("the fakes must not include")

    def test_refuses_sleep_and_conditions_in_the_core(self):
        self.write("Statistics/A.cpp", "void f() { std::this_thread::sleep_for(1s); }\n")
        self.assert_fault("the core sleeps")
        self.write("Statistics/A.cpp", "#ifdef __linux__\n#endif\n")
        self.assert_fault("the core compiles by condition")

    def test_refuses_a_tree_without_sources(self):
        self.assert_fault("no source files")


class CheckKept(CheckTest):
    script = "check_kept"

    def setUp(self):
        super().setUp()
        self.write("Statistics/A.cpp", "// Kept: the first fact, which\n"
                   "// goes on. [KeepsOne]\nint a;\n  // Kept: more. [KeepsTwo]\n")
        self.write("Statistics/ATest.cpp", "TEST(A, KeepsOne) {}\n"
                   "TEST_F(A,\n       KeepsTwo) {}\n")

    def test_writes_the_document(self):
        self.assert_fine()
        text = (self.root / "docs/kept-behaviours.md").read_text(encoding="utf-8")
        self.assertIn("## KeepsOne\n\n- The first fact, which goes on. "
                      "(`Statistics/A.cpp`)\n\nTested in `Statistics/ATest.cpp`.", text)
        self.assert_fine("--check")

    def test_check_writes_nothing_and_notices_an_old_document(self):
        self.assert_fault("not up to date", "--check")
        self.assertFalse((self.root / "docs").exists())
        self.assert_fine()
        self.write("Statistics/B.cpp", "// Kept: elsewhere too. [KeepsOne]\n")
        self.assert_fault("not up to date", "--check")

    def test_misses_a_test(self):
        self.write("Statistics/B.cpp", "// Kept: untested. [KeepsThree]\n")
        self.assert_fault("Statistics/B.cpp:1: no test is named KeepsThree", "--check")

    def test_misses_a_mark(self):
        self.write("platform/BTest.cpp", "TEST(B, KeepsOrder) {}\n")
        self.assert_fine()
        self.write("Statistics/BTest.cpp", "TEST(B, KeepsThree) {}\n")
        self.assert_fault("nothing is marked [KeepsThree]", "--check")

    def test_misses_a_name(self):
        self.write("Statistics/B.cpp", "// Kept: nameless.\nint b;\n")
        self.assert_fault("Statistics/B.cpp:1: a mark ends with", "--check")

    def test_refuses_a_tree_without_marks(self):
        self.write("Statistics/A.cpp", "")
        self.write("Statistics/ATest.cpp", "")
        self.assert_fault("nothing is marked", "--check")


class Limits(CheckTest):
    script = "limits"

    HEADER = "// Says what\n// it is.\n\n// Requests\n\n"
    LIMIT = ("/// Of one frame.\n/// [Frame.IsLimited]\n"
             "inline constexpr std::size_t kFrameBytes = 2 * 1024;\n")

    def write_limits(self, text, tests="TEST(Frame, IsLimited) {"):
        self.write("platform/linux/Limits.h", self.HEADER + text)
        self.write("platform/linux/FrameTest.cpp", tests)
        self.write("docs/limits.md", "")

    def test_writes_each_limit_with_its_value_reason_and_test(self):
        self.write_limits(self.LIMIT + "inline constexpr std::size_t kHalf = "
                          "kFrameBytes / 2;\n")
        self.assert_fine()
        text = (self.root / "docs/limits.md").read_text(encoding="utf-8")
        self.assertIn("\n## Requests\n\n- **kFrameBytes: 2 KiB; kHalf: 1,024.** Of one frame. "
                      "(`Frame.IsLimited`)\n", text)
        self.assert_fine("--check")

    def test_refuses_a_page_that_is_not_up_to_date(self):
        self.write_limits(self.LIMIT)
        self.assert_fault("docs/limits.md: not up to date", "--check")

    def test_refuses_a_limit_without_a_test_or_with_one_that_there_is_not(self):
        self.write_limits(self.LIMIT.replace("/// [Frame.IsLimited]\n", ""))
        self.assert_fault("kFrameBytes names no test")
        self.write_limits(self.LIMIT, tests="")
        self.assert_fault("kFrameBytes: there is no test Frame.IsLimited")

    def test_reads_values_with_units_over_several_lines(self):
        self.write_limits(self.LIMIT.replace("kFrameBytes = 2 * 1024",
                                             "kListBytes =\n    std::size_t{3} * 1024"))
        self.assert_fine()
        self.assertIn("kListBytes: 3 KiB.",
                      (self.root / "docs/limits.md").read_text(encoding="utf-8"))
        self.write_limits(self.LIMIT.replace("std::size_t kFrameBytes = 2 * 1024",
                                             "std::chrono::milliseconds kPause{1000}"))
        self.assert_fine()
        self.assertIn("kPause: 1,000 ms.",
                      (self.root / "docs/limits.md").read_text(encoding="utf-8"))

    def test_refuses_a_limit_that_cannot_be_read(self):
        self.write_limits(self.LIMIT.replace("std::size_t kFrameBytes", "std::size_t frames"))
        self.assert_fault("not limits that can be read")

    def test_refuses_a_limit_without_a_reason(self):
        self.write_limits("inline constexpr std::size_t kFrameBytes = 2;\n")
        self.assert_fault("kFrameBytes gives no reason")


if __name__ == "__main__":
    unittest.main()
