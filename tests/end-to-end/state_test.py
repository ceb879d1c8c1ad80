#!/usr/bin/env python3
"""What the daemon makes of damaged state: annotation files, directories and manifests of every bad kind."""

import os
import subprocess
import unittest

import bundles
import qmx
import scratch

GOOD = "com.example.good"


class StateTest(unittest.TestCase):
    def setUp(self):
        self.platform = scratch.Platform(samples=False)
        self.addCleanup(self.platform.__exit__, None, None, None)
        self.good = bundles.application(self.platform.root, "Good", {"Good.plugin": bundles.manifest(GOOD)})

    def find(self, path):
        with qmx.Connection(self.platform.socket_path) as connection:
            return connection.request({"request": "find", "version": 3, "paths": "file://" + path})

    def assert_serves(self):
        reply = self.find(bundles.plugin_path(self.good, "Good.plugin"))
        self.assertEqual(qmx.decode_matches(reply["matches"])["identifier"], GOOD)

    # The annotation file.

    AUTO_ELECT = {"com.nordane.developer.auto-elect-plugin": True}

    def elect(self, path):
        """The daemon writes the file when it first sees this plug-in."""
        executable = os.path.join(path, "run")
        bundles.write(executable, b"#!/bin/true\n")
        os.chmod(executable, 0o755)
        done = self.platform.zbctl("sign", executable, "-e", "com.nordane.developer.auto-elect-plugin")
        self.assertEqual(done.returncode, 0, done.stderr)

    def prepare_elected(self):
        content = bundles.manifest("com.example.elected")
        content["VBBundleExecutable"] = "run"
        app = bundles.application(self.platform.root, "Elected", {"Elected.plugin": content})
        path = bundles.plugin_path(app, "Elected.plugin")
        self.elect(path)
        return path

    def assert_saved(self, path):
        """The file holds the election of the elected plug-in in the one format."""
        with open(path, encoding="utf-8") as file:
            text = file.read()
        self.assertIn("<integer>16</integer>", text)
        self.assertIn("<key>com.example.elected</key>", text)

    def test_bad_annotation_files_are_reset_and_set_aside_by_the_first_change(self):
        file = self.platform.path("var/db/Zembra-Annotations")
        kept = bundles.vlist({"version": 16, "data": {"com.example.kept": {"election": 2}}})
        cases = {
            "empty": b"",
            "truncated": kept[: len(kept) // 2],
            "of version 15": bundles.vlist({"version": 15, "data": {}}),
            "no property list": b"\x00\x01\x02nonsense",
            "an array": bundles.vlist([1, 2]),
            "wrong data": bundles.vlist({"version": 16, "data": "text"}),
        }
        elected = self.prepare_elected()
        for name, content in cases.items():
            with self.subTest(name):
                bundles.write(file, content)
                self.platform.start()
                self.assert_serves()
                reply = self.find(elected)
                self.assertEqual(qmx.decode_matches(reply["matches"])["annotations"], {"election": 1})
                log = self.platform.stop()
                if name == "wrong data":  # a table that is none is an empty one
                    self.assertNotIn("(resetting)", log)
                else:
                    self.assertIn("unable to load annotation database:", log)
                if name == "of version 15":
                    self.assertIn("found database version 15 needed version 16", log)
                self.assert_saved(file)
                if name != "wrong data":
                    with open(file + ".damaged", "rb") as damaged:
                        self.assertEqual(damaged.read(), content)
                    os.unlink(file + ".damaged")
                self.assertNotIn("Zembra-Annotations.damaged", os.listdir(os.path.dirname(file)))
                os.unlink(self.platform.log_path)

    def test_a_missing_annotation_file_is_silent(self):
        self.platform.start()
        self.assert_serves()
        self.assertNotIn("annotation database", self.platform.stop())
        self.assertFalse(os.path.exists(self.platform.path("var/db/Zembra-Annotations")))

    def test_what_is_stored_survives_and_is_merged(self):
        file = self.platform.path("var/db/Zembra-Annotations")
        bundles.write(file, {"version": 16, "data": {"com.example.kept": {"election": 2}, GOOD: {"extension": {"a": 1}}}})
        elected = self.prepare_elected()
        self.platform.start()
        reply = self.find(bundles.plugin_path(self.good, "Good.plugin"))
        self.assertEqual(qmx.decode_matches(reply["matches"])["annotations"], {"extension": {"a": 1}})
        self.find(elected)
        self.platform.stop()
        with open(file, encoding="utf-8") as stored:
            text = stored.read()
        for key in ("com.example.kept", GOOD, "com.example.elected"):
            self.assertIn(f"<key>{key}</key>", text)

    def test_a_directory_in_the_files_place_costs_only_the_saving(self):
        os.makedirs(self.platform.path("var/db/Zembra-Annotations/inside"))
        elected = self.prepare_elected()
        self.platform.start()
        reply = self.find(elected)
        self.assertEqual(qmx.decode_matches(reply["matches"])["annotations"], {"election": 1})
        log = self.platform.stop()
        self.assertIn("(resetting)", log)
        self.assertIn("unable to save annotations:", log)
        self.assertTrue(os.path.isdir(self.platform.path("var/db/Zembra-Annotations/inside")))

    @unittest.skipIf(os.geteuid() == 0, "nothing is unreadable for root")
    def test_an_unreadable_file_is_reset_and_set_aside(self):
        file = self.platform.path("var/db/Zembra-Annotations")
        bundles.write(file, {"version": 16, "data": {}})
        before = os.stat(file).st_ino
        os.chmod(file, 0)
        elected = self.prepare_elected()
        self.platform.start()
        self.find(elected)
        self.assertIn("(resetting)", self.platform.stop())
        self.assert_saved(file)
        self.assertEqual(os.stat(file + ".damaged").st_ino, before)

    def test_a_full_disk_keeps_the_old_file_and_the_change_in_memory(self):
        # A limit on the size of files stands in for the disk: writing fails at the same place, with EFBIG.
        file = self.platform.path("var/db/Zembra-Annotations")
        stored = {"version": 16, "data": {"com.example.kept": {"extension": {"text": "x" * 200_000}}}}
        bundles.write(file, stored)
        elected = self.prepare_elected()
        self.platform.start()  # once without a limit, so that the registry's database is complete
        self.assert_serves()
        self.platform.stop()
        with open(file, "rb") as before:
            content = before.read()
        os.unlink(self.platform.log_path)
        self.platform.start(wrapper=("bash", "-c", 'ulimit -f 128; exec "$@"', "-"))
        reply = self.find(elected)
        self.assertEqual(qmx.decode_matches(reply["matches"])["annotations"], {"election": 1})
        self.assertIn("unable to save annotations:", self.platform.stop())
        with open(file, "rb") as after:
            self.assertEqual(after.read(), content)
        self.assertEqual(sorted(n for n in os.listdir(os.path.dirname(file)) if "Annotations" in n), ["Zembra-Annotations"])

    # The start and the end.

    def assert_start_fails(self, *reasons):
        done = subprocess.run([os.path.join(scratch.BUILD, "bin", "zbd")], env=self.platform.environment,
                              stdin=subprocess.DEVNULL, capture_output=True, text=True, timeout=scratch.DEADLINE, check=False)
        self.assertEqual(done.returncode, 1, done.stderr)
        for reason in (*reasons, "error [ops] unable to construct server"):
            self.assertIn(reason, done.stderr)

    def test_a_start_in_vain_ends_with_the_reason(self):
        self.platform.start()
        self.assert_start_fails(f"unable to listen for {scratch.SERVICE}: service name taken")
        self.assert_serves()  # the daemon that has the name
        self.platform.stop()
        os.rename(self.platform.path("run/nordane"), self.platform.path("run/other"))
        bundles.write(self.platform.path("run/nordane"), b"")
        self.assert_start_fails(f"unable to listen for {scratch.SERVICE}: ", "Not a directory")
        users = self.platform.path("var/db/users")
        os.rename(users, users + ".other")
        bundles.write(users, b"")
        self.assert_start_fails("failed to get storage container: error=20", "unable to locate user container: error 20",
                                users + ": Not a directory")

    def test_stopping_leaves_no_socket(self):
        self.platform.start()
        self.assertIn("com.nordane.sandbox", os.listdir(self.platform.path("run/nordane")))
        self.platform.stop()
        for name in ("com.nordane.sandbox", scratch.SERVICE):
            self.assertFalse(os.path.lexists(self.platform.path("run/nordane/" + name)), name)

    # Manifests.

    def test_bad_manifests_are_skipped_and_the_rest_is_served(self):
        entity_bomb = b"""<?xml version="1.0"?>
<!DOCTYPE vlist [<!ENTITY a "aaaaaaaaaaaaaaaaaaaaaaaaaaaaaaaa"><!ENTITY b "&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;">
<!ENTITY c "&b;&b;&b;&b;&b;&b;&b;&b;&b;&b;"><!ENTITY d "&c;&c;&c;&c;&c;&c;&c;&c;&c;&c;">]>
<vlist version="1.0"><dict><key>VBBundleIdentifier</key><string>&d;</string></dict></vlist>"""
        wrong = {"VBBundleIdentifier": 7, "VBBundleVersion": [], "VBBundleExecutable": {"a": 1}, "VBBundleDisplayName": True,
                 "VKExtension": {"VKExtensionAttributes": "none", "VKExtensionProtocol": 3, "VKExtensionPointIdentifier": {},
                                 "Shared": 5, "Dedicated": "yes", "HubProtocolVersion": "five", "Multiple": 1,
                                 "VKExtensionFilevaneActions": "no array"}}
        deep = b'<vlist version="1.0">' + b"<array>" * 10_000 + b"</array>" * 10_000 + b"</vlist>"
        plugins = {
            "Array.plugin": bundles.vlist([1, 2, 3]),
            "Bomb.plugin": entity_bomb,
            "Deep.plugin": deep,
            "Empty.plugin": b"",
            "Wrong.plugin": bundles.vlist(wrong),
            "NoExtension.plugin": {"VBBundleIdentifier": "com.example.none"},
            "Actions.plugin": bundles.manifest("com.example.actions", VKExtensionFilevaneActions=[1, {}, {"x": 2}]),
        }
        app = bundles.application(self.platform.root, "Bad", plugins)
        huge = bundles.plugin_path(app, "Huge.plugin/Info.vlist")
        os.makedirs(os.path.dirname(huge))
        with open(huge, "wb") as file:
            file.truncate(100 << 20)
        pipe = bundles.plugin_path(app, "Pipe.plugin")
        os.makedirs(pipe)
        os.mkfifo(os.path.join(pipe, "Info.vlist"))
        self.platform.start()
        self.assert_serves()
        for plugin in [*plugins, "Huge.plugin", "Pipe.plugin"]:
            with self.subTest(plugin):
                reply = self.find(bundles.plugin_path(app, plugin))
                if plugin == "Actions.plugin":
                    self.assertEqual(qmx.decode_matches(reply["matches"])["localizedFilevaneActionNames"], {})
                else:
                    self.assertEqual(reply["errorcode"], 15)
        self.assert_serves()
        self.platform.stop()

    def test_a_manifest_replaced_while_it_is_read_is_the_old_or_the_new_one(self):
        self.platform.start()
        path = bundles.plugin_path(self.good, "Good.plugin")
        manifest = os.path.join(path, "Info.vlist")
        for version in range(100):
            content = bundles.manifest(GOOD, VKExtensionAttributes={"VKExtensionVersion": str(version), "fill": "y" * 50_000})
            bundles.write(manifest, content)
            form = qmx.decode_matches(self.find(path)["matches"])
            self.assertEqual(form["identifier"], GOOD)
            attributes = form["bundleInfo"]["VKExtension"]["VKExtensionAttributes"]
            self.assertEqual(len(attributes.get("fill", "y" * 50_000)), 50_000)
        self.platform.stop()

    def test_shared_paths_that_leave_the_bundle_get_no_token(self):
        shared = ["inside", "../../../../../etc/passwd", "link", "missing", "..", "loop", "../Shared.plugin/inside"]
        app = bundles.application(
            self.platform.root, "Shared", {"Shared.plugin": bundles.manifest("com.example.shared", Shared=[7, *shared])})
        path = bundles.plugin_path(app, "Shared.plugin")
        bundles.write(os.path.join(path, "inside"), b"data")
        os.symlink("/etc/passwd", os.path.join(path, "link"))
        os.symlink("loop", os.path.join(path, "loop"))
        self.platform.start()
        form = qmx.decode_matches(self.find(path)["matches"])
        self.assertEqual(sorted(form["extensions"]), ["../Shared.plugin/inside", "inside"])
        self.assertNotIn("service-extension", form)
        log = self.platform.stop()
        self.assertIn("failed to make extension for ", log)

    # Paths.

    def test_odd_paths_in_requests_are_answered(self):
        os.symlink("loop", self.platform.path("loop"))
        latin = os.path.join(os.fsencode(self.platform.path("Applications")), b"caf\xe9.plugin")
        os.makedirs(latin)
        os.symlink(latin, os.fsencode(self.platform.path("to-latin")))
        self.platform.start()
        cases = {
            "/" + "a/" * 3000: (9, "invalid plugin path: "),
            self.platform.path("loop"): (9, "invalid plugin path: "),
            self.platform.path("to-latin"): (2, "unable to register plug-in at "),
            "relative/path": (9, "absolute path required: relative/path"),
            "": (9, "absolute path required: "),
            self.platform.path("Applications"): (2, "unable to register plug-in at "),
        }
        for path, (code, text) in cases.items():
            with self.subTest(path[:60]), qmx.Connection(self.platform.socket_path) as connection:
                reply = connection.request({"request": "add", "version": 3, "paths": [path]})
                self.assertEqual(reply["errorcode"], code)
                self.assertTrue(reply["error"].startswith(text), reply["error"])
        self.assert_serves()
        self.platform.stop()

    # Crashes.

    def test_kill_9_while_saving_leaves_a_whole_file(self):
        file = self.platform.path("var/db/Zembra-Annotations")
        elected = self.prepare_elected()
        for _ in range(20):
            # Each start without the file elects, and so saves, as soon as the plug-in is asked for.
            if os.path.exists(file):
                os.unlink(file)
            process = self.platform.start()
            with qmx.Connection(self.platform.socket_path) as connection:
                connection.send({"request": "find", "version": 3, "paths": "file://" + elected})
                process.kill()
            process.wait()
            if os.path.exists(file):
                self.assert_saved(file)


if __name__ == "__main__":
    unittest.main()
