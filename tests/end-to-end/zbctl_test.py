"""zbctl's verbs, outputs and exit statuses, against a real daemon on the sample bundles."""

import json
import os
import re
import shutil
import tempfile
import unittest

import bundles
import scratch

MANAGER = "com.nordane.private.zembra.manager"
NOTIFICATION = "com.nordane.zembra.annotation-change"
WORD_COUNT = "Applications/Editor.app/PlugIns/WordCount.appex"
OUTLINE = "aside/Outline.app/PlugIns/Outline.appex"


class WithDaemon(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.platform = scratch.Platform()
        cls.addClassCleanup(cls.platform.__exit__)
        cls.platform.start()

    def expect(self, status, *arguments, **options):
        result = self.platform.zbctl(*arguments, **options)
        self.assertEqual(result.returncode, status, result.stdout + result.stderr)
        return result

    def find(self, *arguments):
        return json.loads(self.expect(0, "--json", "find", *arguments).stdout)


class Find(WithDaemon):
    def test_by_path_url_and_uuid_is_one_plug_in(self):
        path = self.platform.path(WORD_COUNT)
        form = self.find(path)
        known = {"path": path, "identifier": "org.example.editor.word-count", "annotations": {}, "systemResident": False}
        self.assertEqual({key: form[key] for key in known}, known)
        self.assertIs(form["info"]["VKExtensionAttributes"]["ReadsText"], True)
        self.assertEqual(form["info"]["VKExtensionAttributes"]["Languages"], ["en", "de"])
        for location in (["--url", "file://" + path], ["--uuid", form["uuid"]], ["--uuid", form["uuid"].lower()]):
            self.assertEqual(self.find(*location)["uuid"], form["uuid"], location)
        relative = self.platform.zbctl("--json", "find", "--", os.path.basename(path), cwd=os.path.dirname(path))
        self.assertEqual(json.loads(relative.stdout)["uuid"], form["uuid"])

    def test_for_people_names_the_plug_in_first(self):
        lines = self.expect(0, "find", self.platform.path(WORD_COUNT)).stdout.splitlines()
        self.assertEqual(lines[0], "Word Count 2.1")
        self.assertIn("  info:", lines)
        self.assertTrue(any(re.fullmatch(r"  uuid +[0-9A-F-]{36}", line) for line in lines), lines)

    def test_lost_output_is_a_failure(self):
        for arguments in (["--json", "bulk"], ["find", self.platform.path(WORD_COUNT)], ["--help"]):
            with open("/dev/full", "wb") as full:
                result = self.platform.zbctl(*arguments, stdout=full)
            self.assertEqual((result.returncode, result.stderr), (1, "zbctl: the output cannot be written\n"), arguments)

    def test_of_nothing_is_an_error_reply(self):
        for location in (["/"], ["--uuid", "00000000-0000-4000-8000-000000000000"], ["--url", "https://example.org/"]):
            result = self.expect(1, "--json", "find", *location)
            self.assertEqual((result.stdout, result.stderr), ("", "zbctl: error 15: Cannot locate PlugIn\n"))


class Registration(WithDaemon):
    def test_add_and_remove(self):
        outline = self.platform.path(OUTLINE)
        self.expect(1, "find", outline)
        self.assertEqual(self.expect(0, "add", os.path.basename(outline), cwd=os.path.dirname(outline)).stdout, "")
        uuid = self.find(outline)["uuid"]
        self.assertIn("error 9: invalid plugin path: /nowhere", self.expect(1, "add", "/nowhere").stderr)

        self.assertIn("error 11: caller lacks entitlement", self.expect(1, "remove", outline).stderr)
        self.assertEqual(self.find(outline)["uuid"], uuid)

        program = os.path.join(self.platform.directory, "zbctl")
        shutil.copy(os.path.join(scratch.BUILD, "bin", "zbctl"), program)
        if self.platform.zbctl("sign", program, "-e", MANAGER).returncode != 0:
            self.skipTest("the file system keeps no extended attributes")
        self.assertEqual(self.expect(0, "--json", "remove", outline, program=program).stdout, "{}\n")
        self.expect(1, "find", outline)
        self.assertIn("error 9: no plugin at", self.expect(1, "remove", outline, program=program).stderr)
        # Taking the entitlement away works as well as giving it.
        self.expect(0, "sign", program, "--remove")
        self.assertIn("error 11", self.expect(1, "remove", outline, program=program).stderr)

    def test_bulk_passes_its_flags(self):
        self.expect(0, "bulk")
        self.expect(0, "bulk", "--flags", "0xfedcba9876543210")
        self.platform.wait_for_log(r"bulk options 0xfedcba9876543210 not supported")


class Raw(WithDaemon):
    def raw(self, status, request, *options):
        content = request if isinstance(request, str) else json.dumps(request)
        return self.expect(status, *options, "raw", "-", input=content)

    def test_sends_json_with_values_that_json_lacks(self):
        uuid = self.find(self.platform.path(WORD_COUNT))["uuid"]
        request = {"request": "find", "version": 3, "uuids": {"$uuid": uuid}}
        reply = json.loads(self.raw(0, request, "--json").stdout)
        self.assertEqual(reply["matches"]["uuid"], uuid)
        # A UUID's text alone is not a UUID, and neither is an array of them.
        for wrong in (uuid, [{"$uuid": uuid}], {"$data": "AAAA"}, {"$date": "2026-11-22T10:00:00Z"}):
            self.assertIn("error 15", self.raw(1, {**request, "uuids": wrong}).stderr, wrong)

    def test_sends_property_lists(self):
        request = bundles.vlist({"request": "find", "version": 3, "paths": "file://" + self.platform.path(WORD_COUNT)})
        self.assertIn("org.example.editor.word-count", self.raw(0, request.decode()).stdout)
        with tempfile.NamedTemporaryFile() as file:
            file.write(request)
            file.flush()
            self.assertIn("org.example.editor.word-count", self.expect(0, "raw", file.name).stdout)

    def test_changes_nothing_about_the_request(self):
        for request, code, text in (
            ({"request": "find"}, 7, "unsupported protocol version 0 (current 3)"),
            ({"version": 2, "request": "add", "paths": ["relative"]}, 9, "absolute path required: relative"),
        ):
            result = self.raw(1, request, "--json")
            self.assertEqual(result.stderr, f"zbctl: error {code}: {text}\n")
            self.assertEqual(json.loads(result.stdout), {"errorcode": code, "error": text})

    def test_takes_the_nesting_that_messages_may_have(self):
        for depth, status in ((64, 0), (65, 2), (100_000, 2)):
            rest = depth - 1  # the request is the first
            self.raw(status, '{"request": "bulk", "version": 3, "x": ' + "[" * rest + "]" * rest + "}")

    def test_refuses_a_key_that_stands_twice(self):
        for content, key in (('{"request": "bulk", "request": "find", "version": 3}', "request"),
                             ('{"request": "bulk", "version": 3, "x": [{"y": {}, "\\u0079": 1}]}', "y")):
            self.assertEqual(self.raw(2, content).stderr, f'zbctl: -: the key "{key}" stands twice\n')
        self.raw(0, '{"request": "bulk", "version": 3, "x": {"x": {"x": 1}, "y": {"x": 1}}}')

    def test_refuses_what_is_no_request(self):
        for content in ("", "{", "[]", '{"a": null}', '{"a": "\\u0000"}', '{"a": {"$uuid": "x"}}',
                        '{"a": {"$data": "<>"}}', '{"a": {"$date": "yesterday"}}',
                        "<vlist><string>x</string></vlist>", "<vlist><dict>"):
            self.assertNotEqual(self.raw(2, content).stderr, "", content)
        self.assertEqual(self.expect(2, "raw", "/nowhere").stderr, "zbctl: /nowhere: No such file or directory\n")


class WithoutDaemon(unittest.TestCase):
    def setUp(self):
        self.platform = scratch.Platform()
        self.addCleanup(self.platform.__exit__)

    def status(self, *arguments, **options):
        return self.platform.zbctl(*arguments, **options).returncode

    def test_no_daemon_is_status_3(self):
        for arguments in (["bulk"], ["find", "/"], ["add", "/"], ["remove", "/"]):
            self.assertEqual(self.status(*arguments), 3, arguments)
        self.platform.start("-S", "org.example.other", service="org.example.other")
        self.assertEqual(self.status("bulk"), 3)
        self.assertEqual(self.status("--service", "org.example.other", "bulk"), 0)
        self.assertEqual(self.status("bulk", "--service", "org.example.other"), 0)
        self.platform.stop()
        self.assertEqual(self.status("--service", "org.example.other", "bulk"), 3)

    def test_wrong_usage_is_status_2(self):
        program = os.path.join(self.platform.directory, "program")
        shutil.copy(os.path.join(scratch.BUILD, "bin", "zbctl"), program)
        signing = (["sign", program, *rest] for rest in (
            [], ["--show", "--remove"], ["--show", "-e", "a"], ["-e", "=a"], ["-e", b"a=\xff"]))
        flags = (["bulk", "--flags", text] for text in ("many", "-1", "18446744073709551616", "0x"))
        for arguments in ([], ["frobnicate"], ["--frobnicate", "bulk"], ["add"], ["find"], ["find", "--uuid", "x"],
                          ["find", "/", "--url", "file:///"], ["find", "--url", "a b"], ["watch", "--count", "-1"],
                          ["watch", "a/b"], ["watch", ""], ["bulk", "extra"], ["add", ""], ["add", b"/\xff"],
                          *flags, *signing):
            result = self.platform.zbctl(*arguments)
            self.assertEqual((result.returncode, result.stdout), (2, ""), arguments)
            self.assertNotEqual(result.stderr, "", arguments)
        for arguments, complaint in ((["find", ""], "a path in UTF-8"), (["find", "--uuid", ""], "a UUID"),
                                     (["find", "--url", ""], "a URL")):
            self.assertEqual(self.platform.zbctl(*arguments).stderr, f'zbctl: "" is not {complaint}\n')

    def test_help_and_version_are_no_errors(self):
        self.assertRegex(self.platform.zbctl("--version").stdout, r"^zbctl \d")
        text = self.platform.zbctl("--help").stdout
        for verb in ("add", "remove", "bulk", "find", "raw", "sign", "watch"):
            self.assertRegex(text, rf"(?m)^  {verb} ")
            self.assertEqual(self.status(verb, "--help"), 0)

    def test_sign_keeps_what_it_was_given(self):
        program = os.path.join(self.platform.directory, "program")
        shutil.copy(os.path.join(scratch.BUILD, "bin", "zbctl"), program)
        listed = os.path.join(self.platform.directory, "entitlements.vlist")
        bundles.write(listed, {"a": [1], "b": True})
        if self.status("sign", program, "--entitlements", listed, "-e", "b=false", "-e", "c=x=y", "-e", "d") != 0:
            self.skipTest("the file system keeps no extended attributes")
        for expected in ({"a": [1], "b": False, "c": "x=y", "d": True}, {}):
            shown = self.platform.zbctl("--json", "sign", program, "--show")
            self.assertEqual(json.loads(shown.stdout), expected)
            self.assertEqual(self.status("sign", program, "--remove"), 0)
        self.assertEqual(self.status("sign", "/nowhere", "-e", "a"), 1)
        for missing in ("/nowhere", ""):
            self.assertEqual(self.status("sign", program, "--entitlements", missing), 1)
        os.chmod(program, 0o777)  # whoever may write to it could put another program there
        self.assertEqual(self.status("sign", program, "-e", "a"), 1)

    def test_watch_sees_the_daemon_stop(self):
        self.platform.start()
        with self.platform.start_zbctl("watch", "--count", "1") as ends:
            self.assertEqual(ends.stderr.readline(), f"watching {NOTIFICATION}\n")
            self.platform.stop()
            self.assertEqual(ends.communicate(timeout=scratch.DEADLINE)[0], NOTIFICATION + "\n")
            self.assertEqual(ends.returncode, 0)

    def test_output_obeys_no_control_characters(self):
        manifest = self.platform.path(WORD_COUNT + "/Info.vlist")
        with open(manifest, encoding="utf-8") as file:
            text = file.read()
        with open(manifest, "w", encoding="utf-8") as file:
            file.write(text.replace("Word Count", "Word\nCount\x9b31m\\"))
        self.platform.start()
        result = self.platform.zbctl("find", self.platform.path(WORD_COUNT))
        self.assertEqual(result.stdout.splitlines()[0], "Word\\x0aCount?31m\\\\ 2.1")


if __name__ == "__main__":
    unittest.main()
