"""zbctl's command line, outputs and exit statuses."""

import json
import os
import shlex
import unittest

import scratch
from scratch import MANAGER, NOWHERE, error, manifest

XML = "<vlist><dict><key>request</key><string>find</string><key>version</key><integer>3</integer>" \
      "<key>paths</key><string>file://{}</string></dict></vlist>"


class WithDaemon(scratch.Case):
    def prepare(self):
        content = {**manifest("word", "2.1"), "VBBundleDisplayName": "Word\nCount\x9b31m\\"}
        self.app = self.application("Editor", {"Word.plugin": content})
        self.plugin = self.app + "/PlugIns/Word.plugin"
        self.start()

    def test_each_verb_tells_success_and_error(self):
        known, nowhere = str(self.uuid(self.plugin)), str(NOWHERE)
        provide = "com.nordane.developer.zembra.provide-environment"
        manager = self.copy_of_zbctl(self.path("manager"), "-e", MANAGER, "-e", provide)
        unknown, denied = "4: no such plugin (uuid not found)", "11: caller lacks entitlement for this operation"
        for words, good, shown, bad, reason in (
            ("add {}", self.plugin, "", "/nowhere", "9: invalid plugin path: /nowhere"),
            ("find --uuid {}", known, "com.example.word", nowhere, "15: Cannot locate PlugIn"),
            ("match {}", "--all", "com.example.word", "--all", "11: unauthorized discovery flag (ZBDiscoverAll)"),
            ("ready {}", self.plugin, "", nowhere, unknown),
            ("ready -e A=b {}", self.plugin, "", self.plugin, "11: Transmission of environment variables"),
            ("access --consume {}", self.plugin, "Info.vlist", nowhere, unknown),
            ("elect {}", self.plugin, "", "/nowhere", "15: Cannot locate PlugIn"),
            ("bulk-annotate -", known, "", nowhere, "2: no plug-in with the requested uuid"),
            ("annotate --extension - {}", known, "", nowhere, unknown),
            ("hold {} -- echo held", self.app, "held", "/nowhere", "9: invalid path: /nowhere"),
            ("hold --plug-in {} -- echo held", self.plugin, "held", self.app, "9: no plug-in at path:" + self.app),
            ("bulk {}", "--flags=0xfedcba9876543210", "", "", ""), ("release {}", nowhere, "", "", ""),
            ("remove {}", self.plugin, "", self.plugin, denied), ("add {}", self.plugin, "", "", ""),
        ):
            if reason:
                refused = self.zbctl(1, *words.format(bad).split(), input=json.dumps({bad: {"a": 1}}))
                self.assertIn("error " + reason, refused.stderr, words)
            words = words.format(good).split()
            given = self.zbctl(0, *words, program=manager, input=json.dumps({good: {"a": 1}}))
            self.assertIn(shown, given.stdout, words)
        self.wait_for_log(r"bulk options 0xfedcba9876543210 not supported")
        self.assertEqual(self.find(self.plugin)["annotations"], {"election": 1, "extension": {known: {"a": 1}}})
        # The entitlement of the moment counts.
        self.zbctl(0, "sign", manager, "--remove")
        self.assertIn("error " + denied, self.zbctl(1, "remove", self.plugin, program=manager).stderr)

    def test_find_takes_paths_urls_and_uuids(self):
        form = self.find(self.plugin)
        for words in ([self.plugin], ["--url", "file://" + self.plugin], ["--uuid", form["uuid"].lower()],
                      ["--", "Word.plugin"]):
            self.assertEqual(self.zbctl_json("find", *words, cwd=os.path.dirname(self.plugin)), form, words)
        # Control characters of others are shown, not obeyed.
        text = self.zbctl(0, "find", self.plugin).stdout
        self.assertRegex(text, r"^Word\\x0aCount\?31m\\\\ 2\.1\n(.*\n)*  uuid +[0-9A-F-]{36}\n")

    def test_lost_output_is_a_failure(self):
        for arguments in (["--json", "bulk"], ["find", self.plugin], ["--help"]):
            with open("/dev/full", "wb") as full:
                result = self.zbctl(1, *arguments, stdout=full)
            self.assertEqual(result.stderr, "zbctl: the output cannot be written\n", arguments)

    def raw(self, status, content):
        return self.zbctl(status, "--json", "raw", "-", input=content)

    def test_raw_sends_what_it_is_given(self):
        known = str(self.uuid(self.plugin))
        find = '{"request": "find", "version": 3, "uuids": %s}'
        for content in (XML.format(self.plugin), find % f'{{"$uuid": "{known}"}}'):
            self.assertIn("com.example.word", self.raw(0, content).stdout, content)
        # A UUID's text alone is not a UUID, and neither is an array of them.
        for wrong in (f'"{known}"', f'[{{"$uuid": "{known}"}}]', '{"$data": "AA=="}',
                      '{"$date": "2026-11-22T10:00:00Z"}'):
            self.assertEqual(json.loads(self.raw(1, find % wrong).stdout), error(15, "Cannot locate PlugIn"))
        self.assertIn("error 7", self.raw(1, '{"request": "bulk"}').stderr)
        for depth, status in ((63, 0), (64, 2), (100_000, 2)):  # within the request itself
            self.raw(status, '{"request": "bulk", "version": 3, "x": ' + "[" * depth + "]" * depth + "}")

    def test_raw_refuses_what_is_no_request(self):
        twice = '{"request": "bulk", "version": 3, "x": [{"y": {}, "\\u0079": 1}]}'
        self.assertEqual(self.raw(2, twice).stderr, 'zbctl: -: the key "y" stands twice\n')
        for content in ("", "{", "[]", '{"a": null}', '{"a": "\\u0000"}', '{"a": {"$uuid": "x"}}',
                        '{"a": {"$data": "<>"}}', '{"a": {"$date": "yesterday"}}', "<vlist><dict>"):
            self.assertNotEqual(self.raw(2, content).stderr, "", content)


class WithoutDaemon(scratch.Case):
    def test_no_daemon_is_status_3(self):
        for line in ("bulk", "find /", "match", f"ready {NOWHERE}", f"release {NOWHERE}", "hold / -- true"):
            self.zbctl(3, *line.split())
        self.start("-S", "org.example.other", service="org.example.other")
        self.zbctl(3, "bulk")
        self.zbctl(0, "bulk", "--service", "org.example.other")

    def test_wrong_usage_is_status_2(self):
        program = self.copy_of_zbctl(self.path("program"), "-e", "a")
        for line in (
            "", "frobnicate", "--frobnicate bulk", "add", "add ''", "add /\udcff", "bulk extra", "find",
            "bulk --flags many", "bulk --flags -1", "bulk --flags 18446744073709551616", "bulk --flags 0x",
            "find --uuid x", "find / --url file:///", "find --url 'a b'", "watch --count -1", "watch a/b",
            "watch ''", "match -r =x", "match -r a -r a=b", "match --rules /nowhere", "raw /nowhere",
            "match --rules - -r a", "annotate /", "annotate --election -1 /", "elect", "release x", "hold",
            "find ''", "find --uuid ''", "find --url ''", "elect --ignore --reset /", "ready -e x /",
            f"sign {program}", f"sign {program} --show --remove", f"sign {program} --show -e a",
            f"sign {program} -e =a", f"sign {program} -e a=\udcff",
        ):
            result = self.zbctl(2, *shlex.split(line))
            self.assertEqual(result.stdout, "", line)
            self.assertNotEqual(result.stderr, "", line)

    def test_sign_keeps_what_it_was_given(self):
        listed = self.path("entitlements.vlist")
        scratch.write(listed, {"a": [1], "b": True})
        given = ("--entitlements", listed, "-e", "b=false", "-e", "c=x=y", "-e", "d")
        program = self.copy_of_zbctl(self.path("program"), *given)
        for expected in ({"a": [1], "b": False, "c": "x=y", "d": True}, {}):
            self.assertEqual(self.zbctl_json("sign", program, "--show"), expected)
            self.zbctl(0, "sign", program, "--remove")
        os.chmod(program, 0o777)  # whoever may write to it could put another program there
        for refused in (program, "/nowhere"):
            self.zbctl(1, "sign", refused, "-e", "a")


if __name__ == "__main__":
    unittest.main()
