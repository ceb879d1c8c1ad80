"""zbctl's command line, outputs and exit statuses."""

import json
import os
import shlex
import unittest

import scratch
from scratch import MANAGER, error, manifest

XML = "<vlist><dict><key>request</key><string>find</string><key>version</key><integer>3</integer>" \
      "<key>paths</key><string>file://{}</string></dict></vlist>"


class WithDaemon(scratch.Case):
    def prepare(self):
        content = {**manifest("word", "2.1"), "VBBundleDisplayName": "Word\nCount\x9b31m\\"}
        self.plugin = self.application("Editor", {"Word.plugin": content}) + "/PlugIns/Word.plugin"
        self.start()

    def test_find_takes_paths_urls_and_uuids(self):
        form = self.zbctl_json("find", self.plugin)
        self.assertEqual((form["path"], form["identifier"]), (self.plugin, "com.example.word"))
        for location in (["--url", "file://" + self.plugin], ["--uuid", form["uuid"].lower()]):
            self.assertEqual(self.zbctl_json("find", *location), form, location)
        relative = self.zbctl_json("find", "--", "Word.plugin", cwd=os.path.dirname(self.plugin))
        self.assertEqual(relative, form)
        # Control characters of others are shown, not obeyed.
        text = self.zbctl(0, "find", self.plugin).stdout
        self.assertRegex(text, r"^Word\\x0aCount\?31m\\\\ 2\.1\n(.*\n)*  uuid +[0-9A-F-]{36}\n")

    def test_lost_output_is_a_failure(self):
        for arguments in (["--json", "bulk"], ["find", self.plugin], ["--help"]):
            with open("/dev/full", "wb") as full:
                result = self.zbctl(1, *arguments, stdout=full)
            self.assertEqual(result.stderr, "zbctl: the output cannot be written\n", arguments)

    def test_remove_obeys_the_entitlement_of_the_moment(self):
        program = self.copy_of_zbctl(self.path("manager"), "-e", MANAGER)
        self.assertEqual(self.zbctl(0, "--json", "remove", self.plugin, program=program).stdout, "{}\n")
        self.assertIn("error 9: no plugin at", self.zbctl(1, "remove", self.plugin, program=program).stderr)
        self.zbctl(0, "add", "Word.plugin", cwd=os.path.dirname(self.plugin))
        self.zbctl(0, "sign", program, "--remove")
        self.assertIn("error 11", self.zbctl(1, "remove", self.plugin, program=program).stderr)

    def raw(self, status, request, *options):
        content = request if isinstance(request, str) else json.dumps(request)
        return self.zbctl(status, *options, "raw", "-", input=content)

    def test_raw_sends_what_it_is_given(self):
        known = str(self.uuid(self.plugin))
        find = {"request": "find", "version": 3}
        for content in (XML.format(self.plugin), {**find, "uuids": {"$uuid": known}}):
            self.assertIn("com.example.word", self.raw(0, content).stdout, content)
        # A UUID's text alone is not a UUID, and neither is an array of them.
        for wrong in (known, [{"$uuid": known}], {"$data": "AAAA"}, {"$date": "2026-11-22T10:00:00Z"}):
            result = self.raw(1, {**find, "uuids": wrong}, "--json")
            self.assertEqual(result.stderr, "zbctl: error 15: Cannot locate PlugIn\n", wrong)
            self.assertEqual(json.loads(result.stdout), error(15, "Cannot locate PlugIn"))
        self.assertIn("error 7", self.raw(1, {"request": "find"}).stderr)
        self.zbctl(0, "bulk", "--flags", "0xfedcba9876543210")
        self.wait_for_log(r"bulk options 0xfedcba9876543210 not supported")
        for depth, status in ((64, 0), (65, 2), (100_000, 2)):
            rest = depth - 1  # the request is the first
            self.raw(status, '{"request": "bulk", "version": 3, "x": ' + "[" * rest + "]" * rest + "}")

    def test_raw_refuses_what_is_no_request(self):
        for content, key in (('{"request": "bulk", "request": "find", "version": 3}', "request"),
                             ('{"request": "bulk", "version": 3, "x": [{"y": {}, "\\u0079": 1}]}', "y")):
            self.assertEqual(self.raw(2, content).stderr, f'zbctl: -: the key "{key}" stands twice\n')
        self.raw(0, '{"request": "bulk", "version": 3, "x": {"x": {"x": 1}, "y": {"x": 1}}}')
        for content in ("", "{", "[]", '{"a": null}', '{"a": "\\u0000"}', '{"a": {"$uuid": "x"}}',
                        '{"a": {"$data": "<>"}}', '{"a": {"$date": "yesterday"}}', "<vlist><dict>"):
            self.assertNotEqual(self.raw(2, content).stderr, "", content)


class WithoutDaemon(scratch.Case):
    def test_no_daemon_is_status_3(self):
        for arguments in (["bulk"], ["find", "/"], ["add", "/"], ["remove", "/"]):
            self.zbctl(3, *arguments)
        self.start("-S", "org.example.other", service="org.example.other")
        self.zbctl(3, "bulk")
        self.zbctl(0, "--service", "org.example.other", "bulk")
        self.zbctl(0, "bulk", "--service", "org.example.other")

    def test_wrong_usage_is_status_2(self):
        program = self.copy_of_zbctl(self.path("program"), "-e", "a")
        for line in (
            "", "frobnicate", "--frobnicate bulk", "add", "add ''", "add /\udcff", "bulk extra", "find",
            "bulk --flags many", "bulk --flags -1", "bulk --flags 18446744073709551616", "bulk --flags 0x",
            "find --uuid x", "find / --url file:///", "find --url 'a b'", "watch --count -1", "watch a/b",
            "watch ''", "match -r =x", "match -r a -r a=b", "match --rules /nowhere", "raw /nowhere",
            "match --rules - -r a", "annotate /", "annotate --election -1 /", "elect", "release x", "hold",
            "elect --ignore --reset /", "ready -e x /", f"sign {program}", f"sign {program} --show --remove",
            f"sign {program} --show -e a", f"sign {program} -e =a", f"sign {program} -e a=\udcff",
        ):
            result = self.zbctl(2, *shlex.split(line))
            self.assertEqual(result.stdout, "", line)
            self.assertNotEqual(result.stderr, "", line)
        for option, kind in (("", "a path in UTF-8"), ("--uuid", "a UUID"), ("--url", "a URL")):
            result = self.zbctl(2, "find", *option.split(), "")
            self.assertEqual(result.stderr, f'zbctl: "" is not {kind}\n')
        self.assertRegex(self.zbctl(0, "--version").stdout, r"^zbctl \d")

    def test_sign_keeps_what_it_was_given(self):
        listed = self.path("entitlements.vlist")
        scratch.write(listed, {"a": [1], "b": True})
        given = ("--entitlements", listed, "-e", "b=false", "-e", "c=x=y", "-e", "d")
        program = self.copy_of_zbctl(self.path("program"), *given)
        for expected in ({"a": [1], "b": False, "c": "x=y", "d": True}, {}):
            self.assertEqual(self.zbctl_json("sign", program, "--show"), expected)
            self.zbctl(0, "sign", program, "--remove")
        self.zbctl(1, "sign", "/nowhere", "-e", "a")
        self.zbctl(1, "sign", program, "--entitlements", "")
        os.chmod(program, 0o777)  # whoever may write to it could put another program there
        self.zbctl(1, "sign", program, "-e", "a")


if __name__ == "__main__":
    unittest.main()
