#!/usr/bin/env python3
"""zbd's command line, and its life from the first line of the log to SIGTERM."""

import os
import re
import select
import unittest

import bundles
import scratch

LAUNCHING = "info [ops] zbd is launching"
# Without a category: the line belongs to the system's log, not to the daemon's part of it.
VERBOSE = "error verbose option -v is ineffective; use log config --subsystem com.nordane.zembra"
USAGE = "Usage: zbd [-S servicename] [-v]"
NOTIFICATION = "com.nordane.zembra.annotation-change"
SECOND = "org.example.second"


def unknown(letter):
    return f"zbd: invalid option -- '{letter}'"


def incomplete(letter):
    return f"zbd: option requires an argument -- '{letter}'"


def without_time(line):
    return re.sub(r"^\d{4}-\d\d-\d\dT[\d:.]+Z ", "", line)


class CommandLineTest(unittest.TestCase):
    def setUp(self):
        self.platform = scratch.Platform(samples=False)
        self.addCleanup(self.platform.__exit__)
        self.runtime = self.platform.path("run/nordane")

    def test_wrong_usage(self):
        for arguments, complaints in (
            (["-x"], [unknown("x")]),
            (["--help"], [unknown("-")]),
            (["-vxv"], [VERBOSE, unknown("x")]),
            (["-c"], [incomplete("c")]),
            (["-d"], [incomplete("d")]),
            (["-v", "-S"], [VERBOSE, incomplete("S")]),
            (["foo"], []),
            ([""], []),
            (["-"], []),
            (["-v", "foo"], [VERBOSE]),
            (["foo", "-v"], []),  # the first operand ends the options
            (["foo", "-x"], []),
            (["--", "-v"], []),
            (["-S", SECOND, "-c", "5", "foo"], []),
        ):
            with self.subTest(arguments):
                # The program's own name stands before getopt's complaints, so it is called by nothing but that.
                result = self.platform.zbctl(*arguments, program="zbd", env=self.platform.environment,
                                             executable=os.path.join(scratch.BUILD, "bin", "zbd"))
                self.assertEqual((result.returncode, result.stdout), (2, ""))
                self.assertEqual([without_time(line) for line in result.stderr.splitlines()],
                                 [LAUNCHING, *complaints, USAGE])
                self.assertTrue(result.stderr.endswith(USAGE + "\n"))
                self.assertEqual(os.listdir(self.runtime), [])

    def test_verbose_is_said_to_be_ineffective_each_time(self):
        self.platform.start("-v", "-v")
        lines = [without_time(line) for line in self.platform.stop().splitlines()]
        self.assertEqual(lines[:3], [LAUNCHING, VERBOSE, VERBOSE])
        self.assertNotIn(VERBOSE, lines[3:])

    def test_the_last_of_repeated_options_wins(self):
        # Neither file can be read as a database, so the log names the one that was tried.
        files = [os.path.join(self.platform.directory, name) for name in ("first-database", "second-database")]
        for file in files:
            bundles.write(file, b"nonsense")
        self.platform.start("-S", "org.example.first", "-d", files[0], "-S", SECOND, "-d", files[1], service=SECOND)
        self.assertTrue(os.path.exists(os.path.join(self.runtime, SECOND)))
        for name in ("org.example.first", scratch.SERVICE):
            self.assertFalse(os.path.exists(os.path.join(self.runtime, name)), name)
        log = self.platform.stop()
        self.assertRegex(log, "unable to load annotation database:.*second-database")
        self.assertNotIn("first-database", log)

    def test_sigterm_stops_it_cleanly_at_any_time(self):
        watch = self.platform.start_zbctl("watch")
        self.addCleanup(watch.__exit__, None, None, None)
        self.addCleanup(watch.kill)
        self.assertEqual(watch.stderr.readline(), f"watching {NOTIFICATION}\n")
        for _ in range(10):
            self.platform.start()  # returns with the first accepted connection, while the daemon may be setting up
            self.assertEqual(select.select([watch.stdout], [], [], 0)[0], [], "a notification without a reason")
            self.platform.stop()  # checks the status
            self.assertFalse(os.path.lexists(self.platform.socket_path))
            self.assertTrue(select.select([watch.stdout], [], [], scratch.DEADLINE)[0], "no notification")
            self.assertEqual(os.read(watch.stdout.fileno(), 4096).decode(), NOTIFICATION + "\n")
        watch.terminate()
        self.assertEqual(watch.stdout.read(), "")


if __name__ == "__main__":
    unittest.main()
