"""zbd's command line, its start and its end, and what it makes of damaged state and bundles."""

import os
import re
import resource
import shlex
import socket
import unittest
from pathlib import Path

import qmx
import scratch
from scratch import NOWHERE, SERVICE, manifest, names, vlist

LAUNCHING = "info [ops] zbd is launching"
# Without a category: the line belongs to the system's log, not to the daemon's part of it.
VERBOSE = "error verbose option -v is ineffective; use log config --subsystem com.nordane.zembra"
USAGE = "Usage: zbd [-S servicename] [-v]"
INVALID, INCOMPLETE = "zbd: invalid option -- ", "zbd: option requires an argument -- "
KEPT = {"com.example.kept": {"election": 2}, "com.example.good": {"extension": {"a": 1}}}
BOMB = b"<!DOCTYPE vlist [<!ENTITY e0 'x'>" + b"".join(
    b"<!ENTITY e%d '%s'>" % (i, b"&e%d;" % (i - 1) * 10) for i in range(1, 12)) + b"]><vlist>&e11;</vlist>"


def without_time(log):
    return [re.sub(r"^\d{4}-\d\d-\d\dT[\d:.]+Z ", "", line) for line in log.splitlines()]


class State(scratch.Case):
    def prepare(self):
        self.good = self.application("Good", {"Good.plugin": manifest("good")}) + "/PlugIns/Good.plugin"
        self.file = self.path("var/db/Zembra-Annotations")

    def annotations(self):
        return self.find(self.good)["annotations"]

    def elect(self):
        """Has the file changed, and answers the log."""
        self.assertEqual(self.request("annotate", uuids=[self.uuid(self.good)], annotations={"election": 1}), {})
        self.assertEqual(self.annotations()["election"], 1)
        return self.stop()

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
        database = self.path("database")
        scratch.write(database, {"version": 16, "data": KEPT})
        self.start("-v", "-S", "other", "-d", "/nowhere", "-v", "-S", SERVICE, "-d", database)
        self.assertNotIn("other", os.listdir(self.path("run/nordane")))
        self.assertEqual(self.annotations(), {"extension": {"a": 1}})
        lines = without_time(self.elect())
        self.assertEqual((lines[:3], lines.count(VERBOSE)), ([LAUNCHING, VERBOSE, VERBOSE], 2))
        self.assertEqual(sorted(re.findall("com.example.(.*)<", Path(database).read_text())), ["good", "kept"])
        self.assertFalse(os.path.exists(self.file))

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
            self.assertIn("<key>com.example.good</key>", Path(self.file).read_text())
            os.chmod(self.file + ".damaged", 0o600)
            self.assertEqual(Path(self.file + ".damaged").read_bytes(), content)
        os.remove(self.file)
        os.makedirs(self.file + "/kept")
        self.start()
        self.assertRegex(self.elect(), "(?s)unable to load annotation database:.*unable to save annotations:")
        self.assertEqual(os.listdir(self.file), ["kept"])

    def test_neither_a_full_disk_nor_a_kill_costs_what_is_stored(self):
        stored = vlist({"version": 16, "data": {"com.example.good": {"extension": {"text": "x" * 200_000}}}})
        scratch.write(self.file, stored)
        self.start()
        # A limit on the size of files stands in for the disk: writing fails at the same place, with EFBIG.
        resource.prlimit(self.process.pid, resource.RLIMIT_FSIZE, (1 << 17, 1 << 17))
        self.assertIn("unable to save annotations:", self.elect())
        self.assertEqual(Path(self.file).read_bytes(), stored)
        acknowledged, election = 0, {"request": "annotate", "version": 3, "uuids": [NOWHERE], "paths": [self.good]}
        for saved in range(20):
            self.start()
            annotations = self.annotations()
            self.assertEqual(len(annotations["extension"]["text"]), 200_000)
            self.assertGreaterEqual(annotations.get("election", 0), acknowledged)
            with qmx.Connection(self.socket_path) as connection:
                for number in range(acknowledged + 1, acknowledged + 41):
                    connection.send({**election, "annotations": {"election": number}})
                acknowledged += len([connection.receive() for _ in range(saved)])
                self.kill()  # while it saves the next

    def test_bad_manifests_are_skipped_and_the_rest_is_served(self):
        extension = {"VKExtensionAttributes": "x", "VKExtensionProtocol": 3, "VKExtensionPointIdentifier": {}}
        wrong = {"VBBundleIdentifier": 7, "VBBundleVersion": [], "VKExtension": extension}
        shared = [7, "..", "link", "../Empty.plugin/Info.vlist", "/etc/passwd", "./" * 5_000, "loop", "a\xff"]
        loose = manifest("loose", VKExtensionFilevaneActions=[1, {}, {"x": 2}], Shared=shared)
        app = self.application("Bad", {"Empty.plugin": b"", "Wrong.plugin": wrong, "Loose.plugin": loose,
                                       "Bomb.plugin": BOMB, "Huge.plugin": b" " * 100_000_000,
                                       "Array.plugin": [manifest("array")], "\udcff.plugin": [manifest("bytes")]})
        for name, target in (("link", "/etc/passwd"), ("loop", "loop")):
            os.symlink(target, f"{app}/PlugIns/Loose.plugin/{name}")
        self.start()
        forms = self.match()
        self.assertEqual(names(forms), ["good 1.0", "loose 1.0"])
        for form in forms:
            self.assertEqual((form["localizedFilevaneActionNames"], form.get("extensions", {})), ({}, {}))

    def test_manifests_that_are_replaced_while_they_are_read_are_taken_whole_or_not_at_all(self):
        self.start()
        for number in range(40):
            content = vlist(manifest("good", f"{number}.0", {"Text": "x" * 500_000, "Last": f"{number}.0"}))
            scratch.write(self.good + "/Info.vlist", content)
            with open(self.good + "/Info.vlist", "wb") as file:
                file.write(content[:300_000])
                file.flush()
                self.match()
                file.write(content[300_000:])
            for form in self.match():
                if "bundleInfo" in form:  # not if it went since it was found
                    attributes = form["bundleInfo"]["VKExtension"]["VKExtensionAttributes"]
                    self.assertEqual(attributes.get("Last", "1.0"), attributes["VKExtensionVersion"])
        self.until(lambda: names(self.match()) == ["good 39.0"], "the last manifest")

    def test_sigterm_stops_it_cleanly_at_any_time(self):
        for _ in range(10):
            self.start()  # returns with the first accepted connection, while the daemon may be setting up
            self.stop()
            self.assertEqual([path for path in Path(self.path("run/nordane")).iterdir() if path.is_socket()], [])

    def test_a_watch_that_the_service_manager_kept_tells_what_changed_meanwhile(self):
        manager = self.enterContext(socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM))
        manager.bind(self.directory + "/manager")
        self.daemon_environment["NOTIFY_SOCKET"] = self.directory + "/manager"
        store = {}
        self.addCleanup(lambda: [os.close(watch) for watch in store.values()])

        def stop():
            """When all is watched, what "add" waits for. Answers the log."""
            self.request("add", paths=[self.good])
            text, descriptors, _, _ = socket.recv_fds(manager, 4096, 1)
            if text.startswith(b"FDSTOREREMOVE=1"):
                os.close(store.pop(text))
                text, descriptors, _, _ = socket.recv_fds(manager, 4096, 1)
            store[text.replace(b"FDSTORE=1", b"FDSTOREREMOVE=1")] = descriptors[0]
            name = text.decode().removeprefix("FDSTORE=1\nFDNAME=")
            self.daemon_environment |= {"LISTEN_FDS": "1", "LISTEN_FDNAMES": name}
            return self.stop()

        self.start()
        stop()
        for version, is_silent in (("1.0", True), ("2.0", False), ("2.0", True)):
            if not is_silent:
                scratch.write(self.good + "/Info.vlist", vlist(manifest("good", version)))
            self.start(program=("sh", "-c", 'LISTEN_PID=$$ exec "$0" "$@"', scratch.ZBD), pass_fds=[3],
                       preexec_fn=lambda: os.dup2(*store.values(), 3))
            self.assertEqual(names(self.match()), ["good " + version])
            self.assertEqual("nothing changed on disk while" in stop(), is_silent)

    def test_a_second_daemon_of_that_name_ends_with_the_reason(self):
        self.start()
        second = self.run_program(scratch.ZBD, env=self.daemon_environment)
        self.assertEqual(second.returncode, 1, second.stderr)
        reason = f"(?s)unable to listen for {SERVICE}: service name taken.*unable to construct server"
        self.assertRegex(second.stderr, reason)
        self.assertEqual(self.annotations(), {})  # the daemon that has the name goes on


if __name__ == "__main__":
    unittest.main()
