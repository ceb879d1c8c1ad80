#!/usr/bin/env python3
"""Discovery, annotations and holds: every reply, and who is offered what, by real clients of a real daemon."""

import contextlib
import fcntl
import json
import os
import shutil
import signal
import unittest
import uuid

import bundles
import qmx
import scratch

ALL_VERSIONS, DUPLICATES, SYSTEM_ONLY, ALL = 0x1, 0x4, 0x8, 0x200
PLUG_INS, REFUSE_WHEN_BUSY, TERMINATE = 1, 2, 4
NOWHERE = uuid.UUID("00000000-0000-4000-8000-000000000000")


def manifest(name, version="1.0", attributes=None, **extension):
    return bundles.manifest("com.example." + name, **extension,
                            VKExtensionAttributes={"VKExtensionVersion": version, **(attributes or {})})


class WithDaemon(unittest.TestCase):
    """A: versions 1.2 of "p" and more; B: version 1.10 of "p"; the system volume: the same version."""

    @classmethod
    def setUpClass(cls):
        cls.platform = scratch.Platform(samples=False)
        cls.addClassCleanup(cls.platform.__exit__, None, None, None)
        root = cls.platform.root
        cls.zbctl = os.path.join(scratch.BUILD, "bin", "zbctl")
        cls.a = bundles.application(root, "A", {
            "P.plugin": manifest("p", "1.2", {"Tags": ["5", "6"], "Type": "org.example.drawing", "Flag": False, "One": 1, "Mark": "x"}),
            "Own.plugin": manifest("own", Dedicated=True),
            "Guarded.plugin": manifest("guarded", VKExtensionHostEntitlement="com.example.needed"),
            "Twin.plugin": manifest("twin"),
        })
        cls.b = bundles.application(root, "B", {"P.plugin": manifest("p", "1.10"), "Twin.plugin": manifest("twin", "2.0")})
        cls.p = bundles.plugin_path(cls.a, "P.plugin")
        cls.newer = bundles.plugin_path(cls.b, "P.plugin")
        bundles.write(cls.platform.path("System/Library/PlugIns/P.plugin/Info.vlist"), manifest("p", "1.10"))
        bundles.write(cls.platform.path("etc/nordane/types.d/test.vlist"),
                      {"types": {"org.example.drawing": ["org.example.picture"], "org.example.picture": ["org.example.any"]}})
        bundles.write(cls.a + "/Info.vlist", {"VBBundleIdentifier": "com.example.A", "VBBundleExecutable": "host"})
        replacing = bundles.application(root, "C", {
            "R.plugin": {**manifest("replacing"), "VBBundleExecutable": "program"}}) + "/PlugIns/R.plugin/program"
        # Hosts are copies of zbctl: elsewhere, with entitlements, inside an application.
        cls.manager, cls.restricted, cls.entitled = (os.path.join(cls.platform.directory, name)
                                                     for name in ("manager", "restricted", "entitled"))
        cls.inside = cls.a + "/host"
        for program in (cls.manager, cls.restricted, cls.entitled, cls.inside, replacing):
            shutil.copy(cls.zbctl, program)
        restriction = cls.platform.path("restriction.vlist")
        bundles.write(restriction, {"com.nordane.developer.zembra.allowedplugins": {"VKExtensionVersion": ">=2"}})
        for program, *entitlement in ((cls.manager, "-e", "com.nordane.private.zembra.manager"), (cls.restricted, "--entitlements", restriction),
                                      (cls.entitled, "-e", "com.example.needed"),
                                      (replacing, "-e", "com.nordane.developer.replace-plugin=com.example.twin")):
            if cls.platform.zbctl("sign", program, *entitlement).returncode != 0:
                raise unittest.SkipTest("the file system keeps no extended attributes")
        cls.platform.start()

    def request(self, kind, version=3, **message):
        with qmx.Connection(self.platform.socket_path) as connection:
            return connection.request({"request": kind, "version": version, **message})

    def forms(self, flags=0, **message):
        return qmx.decode_matches(self.request("match", flags=flags, **message)["matches"])

    def names(self, flags=0, **message):
        return sorted(form["identifier"].removeprefix("com.example.") + form["version"]
                      for form in self.forms(flags, **message))

    def found(self, **message):
        return qmx.decode_matches(self.request("find", **message)["matches"])

    def uuid(self, path):
        return uuid.UUID(self.found(paths="file://" + path)["uuid"])

    def assert_error(self, reply, code, text):
        self.assertEqual((reply.get("errorcode"), reply.get("error")), (code, text))

    @contextlib.contextmanager
    def one_notification(self):
        with self.platform.start_zbctl("watch", "--count", "1") as watch:
            watch.stderr.readline()
            yield
            self.assertEqual(watch.communicate(timeout=scratch.DEADLINE)[0], "com.nordane.zembra.annotation-change\n")

    def expect(self, status, *arguments, **options):
        result = self.platform.zbctl(*arguments, **options)
        self.assertEqual(result.returncode, status, (arguments, result.stdout, result.stderr))
        return result


class Requests(WithDaemon):
    def test_error_replies(self):
        known, elected = [self.uuid(self.p)], {"election": 1}
        text, other = str(known[0]), str(self.uuid(self.newer))
        rules, dictionary = "invalid request format (bad rules dictionary)", "invalid request format (bad annotations dictionary)"
        unknown, election = "no such plugin (uuid not found)", "invalid request format (annotation election)"
        for kind, code, error, *messages in (
            ("match", 4, rules, {"rules": "x"}, {"rules": []}, {"rules": 1}),
            ("match", 11, "unauthorized discovery flag (ZBDiscoverAll)", {"flags": ALL}, {"flags": ALL | SYSTEM_ONLY}),
            ("annotate", 4, dictionary, {"uuids": known}, {"uuids": known, "annotations": []}),
            ("annotate", 4, election, {"uuids": known, "annotations": {"election": "1", "extension": {}}}),
            ("annotate", 4, "invalid request format (annotation extension)",
             {"uuids": known, "annotations": {"election": 1, "extension": 1}}),
            ("annotate", 4, "invalid request format (uuid)", {"annotations": elected}, {"uuids": known[0], "annotations": elected}),
            ("annotate", 4, "invalid request (bad uuid array)", {"uuids": [text], "annotations": elected}),
            ("annotate", 4, unknown, {"uuids": [NOWHERE], "annotations": elected},
             {"uuids": [NOWHERE], "paths": [self.p] * 2, "annotations": elected},
             {"uuids": [NOWHERE], "paths": ["/nowhere"], "annotations": elected}),
            ("bulk-annotate", 4, dictionary, {}, {"annotations": []}),
            ("bulk-annotate", 18, "annotations values must be dictionaries", {"annotations": {text: 1}}, {"annotations": {"x": 1}}),
            ("bulk-annotate", 18, "invalid plug-in UUID value", {"annotations": {"x": {}}}),
            ("bulk-annotate", 2, "no plug-in with the requested uuid", {"annotations": {str(NOWHERE): {}, other: {}}}),
            ("lock", 4, "invalid request format", {}, {"paths": self.a}, {"paths": [1]}, {"uuids": NOWHERE}),
            ("lock", 9, "absolute path required: x", {"paths": ["x"]}),
            ("lock", 9, "invalid path: /nowhere", {"paths": [self.a, "/nowhere"]}),
            ("lock", 9, "no plug-in at path:" + self.a, {"paths": [self.p, self.a], "flags": PLUG_INS}),
        ):
            for message in messages:
                with self.subTest(kind + str(message)):
                    self.assert_error(self.request(kind, **message), code, error)
        # Nothing was elected, and nothing is held.
        self.assertEqual(self.names(rules={"VKUserElection": ["0"]}), ["p1.10", "replacing1.0", "twin2.0"])

    def test_replies_without_content(self):
        for kind, message in (("annotate", {"annotations": {"other": 1}}), ("lock", {"uuids": []}),
                              ("lock", {"uuids": [NOWHERE, "x", 1]}), ("ready", {"uuids": []})):
            self.assertEqual(self.request(kind, **message), {}, kind)
        self.assertEqual(self.request("match", version=2), {})
        for message in ({"flags": "8"}, {"flags": -1}, {"rules": {}}):
            self.assertEqual(len(self.forms(**message)), 3, message)


class Match(WithDaemon):
    def test_rules(self):
        p = {"VKExtensionIdentifier": "com.example.p", "Mark": "x"}
        for key, pattern, matches in (
            ("VKExtensionVersion", "=1.2", True), ("VKExtensionVersion", "=01.0002", True),
            ("VKExtensionVersion", "<1.10", True), ("VKExtensionVersion", ">1.9", False),
            ("VKExtensionVersion", "<>1.2", False), ("VKExtensionVersion", ["0", "1.2"], True),
            ("VKExtensionVersion", ["0", "?LIKE:1"], False), ("VKExtensionVersion", [True], False),
            ("VKExtensionVersion", 2, False), ("VKExtensionVersion", {}, False), ("VKExtensionVersion", [], False),
            ("Tags", "<>5", True), ("Tags", ["4", "6"], True), ("Tags", "=4", False), ("Tags", True, True),
            ("Type", "?KT-CONFORMS:org.example.any", True), ("Type", "?KT-CONFORMS:org.example.other", False),
            ("Type", "?KT-IS:org.example.drawing", True), ("Type", "?KT-IS:org.example.any", False),
            ("Flag", False, True), ("Flag", True, False), ("One", True, True), ("One", "1", False), ("One", 1.0, True),
            ("Nothing", False, True), ("Nothing", True, False), ("Nothing", "<>x", False),
            ("VBBundleDisplayName", "com.example.p", True), ("VBBundleDisplayName", "com.example.P", False),
            ("VKExtensionContainingApp", self.a, True), ("VKExtensionContainingApp", False, False),
            ("com.nordane.uuid", str(self.uuid(self.p)).upper(), True),
            ("com.nordane.uuid", str(self.uuid(self.p)).lower(), False),
            ("ENTITLEMENT:com.example.x", False, True), ("VKUserElection", "0", True), ("VKUserElection", "<>2", True),
        ):
            self.assertEqual(self.names(ALL_VERSIONS, rules={**p, key: pattern}), ["p1.2"] if matches else [], (key, pattern))
        self.platform.wait_for_log(r"unrecognized match operator:\?LIKE:1")

    def test_selection(self):
        offered = ["p1.10", "replacing1.0", "twin2.0"]
        for program, options, expected in (
            (self.zbctl, [], offered),
            (self.zbctl, ["--system-only"], ["p1.10"]),
            (self.zbctl, ["--all-versions"], ["p1.10", "p1.2", "replacing1.0", "twin1.0", "twin2.0"]),
            (self.zbctl, ["--all-versions", "--duplicates"],
             ["p1.10", "p1.10", "p1.2", "replacing1.0", "twin1.0", "twin2.0"]),
            (self.manager, ["--all", "--system-only"], ["guarded1.0", "own1.0", "p1.10", "replacing1.0", "twin2.0"]),
            (self.entitled, [], ["guarded1.0", *offered]),
            (self.restricted, [], ["twin2.0"]),
            # Its own copies come first, whatever their versions; and what is dedicated to it.
            (self.inside, ["--all-versions"], ["own1.0", "p1.2", "replacing1.0", "twin1.0"]),
        ):
            forms = json.loads(self.expect(0, "--json", "match", *options, program=program).stdout)
            found = sorted(form["identifier"].removeprefix("com.example.") + form["version"] for form in forms)
            self.assertEqual(found, expected, (program, options))
        self.assertEqual([form["path"] for form in self.forms(rules={"VKExtensionIdentifier": "com.example.p"})],
                         [self.platform.path("System/Library/PlugIns/P.plugin")])
        self.platform.wait_for_log(rf"Ignoring .* @ '{self.newer}' in favor of bundle-relative '{self.p}'")

    def test_replaced_and_replacing_name_each_other(self):
        forms = {form["identifier"]: form for form in self.forms(rules={"VKExtensionProtocol": False})}
        replaced, replacing = forms["com.example.twin"], forms["com.example.replacing"]
        self.assertEqual((replaced["overrider"], replacing["overriding"]), (replacing["uuid"], "com.example.twin"))
        table = self.expect(0, "match").stdout
        self.assertIn("(replaces com.example.twin)\n", table)
        self.assertIn(f"(replaced by {replacing['uuid']})\n", table)

    def test_exclusions(self):
        directory = self.platform.path(f"var/db/users/{os.getuid()}/Preferences")
        os.makedirs(directory, mode=0o700)
        os.chmod(os.path.dirname(directory), 0o700)
        file = os.path.join(directory, f"com.nordane.zembra.userprefs.{os.uname().nodename}.vlist")
        for exclusions, expected in (
            ([4, {"VKExtensionIdentifier": "com.example.twin"}, {"VKExtensionVersion": "1.10"}], ["p1.2", "replacing1.0"]),
            ("x", ["p1.10", "replacing1.0", "twin2.0"]),
        ):
            bundles.write(file, {"exclusions": exclusions})
            self.assertEqual(self.names(), expected, exclusions)
        self.platform.wait_for_log(rf"client {os.getpid()} plugin .* globally excluded")


class Annotate(WithDaemon):
    def test_annotate(self):
        with self.one_notification():  # found by its path; bits 8 to 15 are hosts' own
            self.assertEqual(self.request("annotate", uuids=[NOWHERE], paths=[self.p], annotations={"election": 257}), {})
        self.assertEqual(self.names(ALL_VERSIONS, rules={"VKUserElection": "1"}), ["p1.10", "p1.2"])  # of the identifier
        self.assertEqual(self.request("annotate", uuids=[self.uuid(self.p), NOWHERE], annotations={"election": 2})["errorcode"], 4)
        self.assertEqual({form["annotations"].get("election") for form in self.forms()}, {2, None})  # what came before stays

    def test_bulk_annotate(self):
        known, other = str(self.uuid(self.newer)), str(self.uuid(self.a + "/PlugIns/Own.plugin"))
        for annotations in ({}, {known: {"color": "blue"}}):
            with self.one_notification():
                self.assertEqual(self.request("bulk-annotate", annotations=annotations), {})
        form = self.forms(rules={"VKExtensionIdentifier": "com.example.p"})[0]
        self.assertEqual(form["annotations"]["extension"], {"color": "blue"})
        self.assertEqual(self.request("bulk-annotate", annotations={other: {"a": 1}, str(NOWHERE): {}})["errorcode"], 2)
        self.assertEqual(self.found(uuids=uuid.UUID(other))["annotations"], {"extension": {"a": 1}})


class Lock(WithDaemon):
    def test_a_hold_lasts_until_its_token_or_its_client(self):
        twin = {"VKExtensionIdentifier": "com.example.twin"}
        with qmx.Connection(self.platform.socket_path) as holder:
            def lock(*paths, flags=0):
                return holder.request({"request": "lock", "version": 3, "paths": list(paths), "flags": flags})["uuids"]

            with self.one_notification():
                first = lock(self.a)
            second = lock(self.a + "/PlugIns/Twin.plugin", self.a + "/PlugIns/Twin.plugin", flags=PLUG_INS | TERMINATE)
            lock("/tmp")  # nothing is in there
            self.assertEqual(self.names(ALL_VERSIONS, rules=twin), ["twin2.0"])
            self.assertEqual(len(json.loads(self.expect(0, "--json", "match", "--all", program=self.manager).stdout)), 5)
            self.assert_error(self.request("ready", uuids=[self.uuid(self.p)]), 11,
                              "access to plugin com.example.p denied: the plug-in is on hold")
            self.assertEqual(self.request("lock", uuids=[first]), {})  # by another client than the holder
            self.assertEqual(self.request("ready", uuids=[self.uuid(self.p)]), {})
            self.assertEqual(self.names(ALL_VERSIONS, rules=twin), ["twin2.0"])
            with self.one_notification():
                holder.close()
            self.platform.wait_for_log(rf"releasing plug-in hold {str(second).upper()} for dead client pid {os.getpid()}")
        self.assertEqual(self.names(ALL_VERSIONS, rules=twin), ["twin1.0", "twin2.0"])

    def test_busy_plug_ins_refuse_and_are_named(self):
        directory = self.platform.path(f"run/nordane/vigild/{os.getuid()}")
        os.makedirs(directory, mode=0o700)
        with open(os.path.join(directory, "com.example.p"), "w", encoding="ascii") as file:
            fcntl.lockf(file, fcntl.LOCK_EX)
            reply = self.request("lock", paths=[self.a, self.b], flags=REFUSE_WHEN_BUSY)
            self.assert_error(reply, 14, "plug-ins are busy")
            self.assertEqual(reply["conflicts"], [{"VBBundleIdentifier": "com.example.p"}] * 2)
            self.assertIn("uuids", self.request("lock", paths=[self.a]))
            refused = self.expect(1, "hold", "--refuse-when-busy", self.a, "--", "true").stderr
            self.assertEqual(refused, "zbctl: error 14: plug-ins are busy\nzbctl: busy: com.example.p\n")
        self.assertIn("uuids", self.request("lock", paths=[self.a], flags=REFUSE_WHEN_BUSY))


class Zbctl(WithDaemon):
    def test_rules_of_the_command_line(self):
        for rules, expected in ((["Tags"], ["p1.2"]), (["Tags=5", "Tags=x"], ["p1.2"]), (["Tags==5"], ["p1.2"]),
                                (["One=true", "Flag=false"], ["p1.2"]), (["Flag==false"], []), (["Tags=>=7"], [])):
            arguments = [word for rule in rules for word in ("-r", rule)]
            forms = json.loads(self.expect(0, "--json", "match", "--all-versions", *arguments).stdout)
            self.assertEqual([form["identifier"][12:] + form["version"] for form in forms], expected, rules)
        for content in ('{"Tags": ["5"]}', bundles.vlist({"Tags": "5"}).decode()):
            self.assertIn(" 1.2 ", self.expect(0, "match", "--all-versions", "--rules", "-", input=content).stdout)
        self.assertEqual(self.expect(0, "match", "-r", "Tags=x").stdout, "no plug-in matches\n")
        for wrong in (["match", "-r", "=x"], ["match", "-r", "a", "-r", "a=b"], ["match", "--rules", "/nowhere"],
                      ["match", "--rules", "-", "-r", "a"], ["annotate", self.p], ["elect"], ["elect", "--ignore", "--reset", self.p],
                      ["annotate", "--election", "-1", self.p], ["hold"], ["release", "x"], ["ready", "-e", "x", self.p]):
            self.expect(2, *wrong, input="[]")

    def test_elections_by_name(self):
        for option, shown in ((["--ignore"], "ignore"), ([], "use"), (["--reset"], "-")):
            self.expect(0, "elect", *option, self.p, str(self.uuid(self.newer)))
            self.assertRegex(self.expect(0, "match").stdout, rf"com\.example\.p +1\.10 +[0-9A-F-]{{36}}  {shown} ")
        self.assertIn("error 15", self.expect(1, "elect", "/nowhere").stderr)

    def test_a_hold_lasts_as_long_as_its_command(self):
        tags = [self.zbctl, "match", "--all-versions", "-r", "Tags"]
        self.assertEqual(self.expect(0, "hold", self.a, "--", *tags).stdout, "no plug-in matches\n")
        self.expect(7, "hold", self.a, "--", "sh", "-c", "exit 7")
        self.expect(128 + signal.SIGKILL, "hold", self.a, "--", "sh", "-c", "kill -9 $$")
        self.expect(127, "hold", self.a, "--", "/nowhere")
        for end in ("signal", "release and signal", "daemon"):
            with self.platform.start_zbctl("hold", "--plug-in", self.p) as holder:
                self.addCleanup(holder.kill)
                token = holder.stdout.readline().strip()
                holder.stderr.readline()
                self.assertEqual(self.expect(0, *tags[1:]).stdout, "no plug-in matches\n")
                if "release" in end:
                    self.expect(0, "release", token)
                if "signal" in end:
                    holder.terminate()
                else:
                    self.platform.process.kill()
                self.assertEqual(holder.wait(scratch.DEADLINE), 3 if end == "daemon" else 0)
            if end == "daemon":
                self.platform.process.wait()
                self.platform.start()
            self.assertIn("com.example.p", self.expect(0, *tags[1:]).stdout)

    def test_access_and_inspect(self):
        accessed = json.loads(self.expect(0, "--json", "access", "--consume", self.p, str(self.uuid(self.a + "/PlugIns/Own.plugin"))).stdout)
        self.assertEqual([entry["names"] for entry in accessed], [["Info.vlist"]] * 2)
        sdk = self.platform.path("System/Library/SDKs/com.example.point.vlist")
        bundles.write(sdk, {"VKExtension": {"VKExtensionProtocol": "x", "CleanTimeout": 5, "VKExtensionAttributes": {"Added": "1"}}})
        outside = self.platform.path("Outside.plugin")
        bundles.write(outside + "/Info.vlist", manifest("outside"))
        inspected = json.loads(self.expect(0, "--json", "inspect", self.p).stdout)
        self.assertEqual(set(inspected), {"form", "sdk"})
        info = inspected["form"]["info"]
        self.assertEqual((info["VKExtensionProtocol"], info["CleanTimeout"], info["VKExtensionAttributes"]["Added"]), ("#Data", 5, "1"))
        self.assertEqual(inspected["form"]["containingPath"], self.a)
        self.assertIn("neither in an application nor in System", self.expect(1, "inspect", outside).stdout)
        for path in ("/nowhere", self.a):
            self.assertEqual(self.expect(1, "inspect", path).stdout, "")


if __name__ == "__main__":
    unittest.main()
