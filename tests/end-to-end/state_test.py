"""zbd's command line, its start and its end, and what it makes of damaged state."""

import os
import re
import resource
import shlex
import signal
import unittest

import qmx
import scratch
from scratch import manifest, vlist

LAUNCHING = "info [ops] zbd is launching"
# Without a category: the line belongs to the system's log, not to the daemon's part of it.
VERBOSE = "error verbose option -v is ineffective; use log config --subsystem com.nordane.zembra"
USAGE = "Usage: zbd [-S servicename] [-v]"
INVALID, INCOMPLETE = "zbd: invalid option -- ", "zbd: option requires an argument -- "
KEPT = {"com.example.kept": {"election": 2}, "com.example.good": {"extension": {"a": 1}}}


def without_time(log):
    return [re.sub(r"^\d{4}-\d\d-\d\dT[\d:.]+Z ", "", line) for line in log.splitlines()]


class CommandLine(scratch.Case):
    def test_wrong_usage(self):
        for line, *complaints in (
            ("-x", INVALID + "'x'"), ("--help", INVALID + "'-'"), ("-vxv", VERBOSE, INVALID + "'x'"),
            ("-c", INCOMPLETE + "'c'"), ("-d", INCOMPLETE + "'d'"), ("-v -S", VERBOSE, INCOMPLETE + "'S'"),
            # The first operand ends the options.
            ("foo",), ("''",), ("-",), ("-v foo", VERBOSE), ("foo -v",), ("-- -v",), ("-S x -c 5 foo",),
        ):
            # Its own name stands before getopt's complaints, so it is called by nothing but that.
            result = self.run_program("zbd", *shlex.split(line), env=self.daemon_environment,
                                      executable=scratch.ZBD)
            self.assertEqual((result.returncode, result.stdout), (2, ""), line)
            self.assertEqual(without_time(result.stderr), [LAUNCHING, *complaints, USAGE], line)
            self.assertEqual(os.listdir(self.path("run/nordane")), [])

    def test_the_last_of_repeated_options_wins(self):
        # Neither file can be read as a database, so the log names the one that was tried.
        first, second = self.path("first-database"), self.path("second-database")
        scratch.write(first, b"nonsense")
        scratch.write(second, b"nonsense")
        self.start("-v", "-S", "first", "-d", first, "-v", "-S", "second", "-d", second, service="second")
        self.assertTrue({"first", scratch.SERVICE}.isdisjoint(os.listdir(self.path("run/nordane"))))
        log = self.stop()
        self.assertRegex(log, "unable to load annotation database:.*second-database")
        self.assertNotIn("first-database", log)
        lines = without_time(log)
        self.assertEqual((lines[:3], lines.count(VERBOSE)), ([LAUNCHING, VERBOSE, VERBOSE], 2))


class State(scratch.Case):
    def prepare(self):
        self.good = self.application("Good", {"Good.plugin": manifest("good")}) + "/PlugIns/Good.plugin"
        self.file = self.path("var/db/Zembra-Annotations")

    def election(self, number=1):
        return {"uuids": [self.uuid(self.good)], "annotations": {"election": number}}

    def annotations(self):
        return self.find(self.good)["annotations"]

    def elect(self):
        """Has the file saved, and answers the log."""
        self.assertEqual(self.request("annotate", **self.election()), {})
        log = self.stop()
        with open(self.file, encoding="utf-8") as file:
            self.assertIn("<key>com.example.good</key>", file.read())
        return log

    def test_what_is_stored_survives_and_is_merged(self):
        self.start()
        self.assertEqual(self.annotations(), {})
        self.stop()
        self.assertFalse(os.path.exists(self.file))
        scratch.write(self.file, {"version": 16, "data": KEPT})
        self.start()
        self.assertEqual(self.annotations(), {"extension": {"a": 1}})
        self.assertNotIn("annotation database", self.elect())
        with open(self.file, encoding="utf-8") as file:
            self.assertIn("<key>com.example.kept</key>", file.read())
        self.start()
        self.assertEqual(self.annotations(), {"election": 1, "extension": {"a": 1}})

    def test_bad_annotation_files_are_reset_and_set_aside_by_the_first_change(self):
        for content, mode, reason in (
            (vlist({"version": 16, "data": KEPT})[:50], 0o600, ""), (b"unreadable", 0, ""), (b"", 0o600, ""),
            (vlist({"version": 15, "data": KEPT}), 0o600, "found database version 15 needed version 16"),
        ):
            scratch.write(self.file, content)
            os.chmod(self.file, mode)
            self.start()
            self.assertEqual(self.annotations(), {})
            self.assertRegex(self.elect(), "unable to load annotation database:.*" + reason)
            os.chmod(self.file + ".damaged", 0o600)
            with open(self.file + ".damaged", "rb") as damaged:
                self.assertEqual(damaged.read(), content)

    def test_neither_a_full_disk_nor_a_kill_costs_what_is_stored(self):
        stored = vlist({"version": 16, "data": {"com.example.good": {"extension": {"text": "x" * 200_000}}}})
        scratch.write(self.file, stored)
        self.start()
        # A limit on the size of files stands in for the disk: writing fails at the same place, with EFBIG.
        resource.prlimit(self.process.pid, resource.RLIMIT_FSIZE, (1 << 17, 1 << 17))
        self.assertEqual(self.request("annotate", **self.election()), {})
        self.assertEqual(self.annotations()["election"], 1)
        self.assertIn("unable to save annotations:", self.stop())
        with open(self.file, "rb") as file:
            self.assertEqual(file.read(), stored)
        for number in range(20):
            self.start()
            with qmx.Connection(self.socket_path) as connection:
                connection.send({"request": "annotate", "version": 3, **self.election(number)})
                self.kill()
        self.start()
        self.assertEqual(len(self.annotations()["extension"]["text"]), 200_000)

    def test_bad_manifests_are_skipped_and_the_rest_is_served(self):
        extension = {"VKExtensionAttributes": "x", "VKExtensionProtocol": 3, "VKExtensionPointIdentifier": {}}
        wrong = {"VBBundleIdentifier": 7, "VBBundleVersion": [], "VKExtension": extension}
        loose = manifest("loose", VKExtensionFilevaneActions=[1, {}, {"x": 2}], Shared=[7, ".."])
        self.application("Bad", {"Empty.plugin": b"", "Wrong.plugin": wrong, "Loose.plugin": loose})
        self.start()
        forms = self.match()
        self.assertEqual(scratch.names(forms), ["good 1.0", "loose 1.0"])
        for form in forms:
            self.assertEqual((form["localizedFilevaneActionNames"], form.get("extensions", {})), ({}, {}))

    def test_sigterm_stops_it_cleanly_at_any_time(self):
        for _ in range(10):
            self.start()  # returns with the first accepted connection, while the daemon may be setting up
            self.stop()
            for name in (scratch.SERVICE, "com.nordane.sandbox", "com.nordane.ignitd"):
                self.assertFalse(os.path.lexists(self.path("run/nordane/" + name)), name)

    def assert_start_fails(self, status, *reasons):
        done = self.run_program(scratch.ZBD, env=self.daemon_environment)
        self.assertEqual(done.returncode, status, done.stderr)
        for reason in reasons:
            self.assertIn(reason, done.stderr)

    def test_a_start_without_its_name_ends_with_the_reason(self):
        reason = f"unable to listen for {scratch.SERVICE}: "
        self.start()
        self.assert_start_fails(1, reason + "service name taken", "error [ops] unable to construct server")
        self.assertEqual(self.annotations(), {})  # the daemon that has the name goes on
        self.stop()
        os.rename(self.path("run/nordane"), self.path("run/other"))
        scratch.write(self.path("run/nordane"), b"")
        self.assert_start_fails(1, reason, "Not a directory", "error [ops] unable to construct server")

    def test_a_start_without_its_container_ends_with_the_reason(self):
        scratch.write(self.path("var/db/users"), b"")
        self.assert_start_fails(-signal.SIGABRT, "failed to get storage container: error=20",
                                "unable to locate user container: error 20")


if __name__ == "__main__":
    unittest.main()
