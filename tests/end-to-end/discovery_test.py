"""Who is offered what, annotations and holds, with zbctl and with a client that shares no code with zbd."""

import contextlib
import os
import unittest

import qmx
import scratch
from scratch import DEADLINE, MANAGER, NOWHERE, ZBCTL, error, manifest, names

ALL_VERSIONS, PLUG_INS, TERMINATE = 1, 1, 4  # flags of "match" and of "lock"
TWINS = ["twin 1.0", "twin 2.0"]


class Discovery(scratch.Case):
    """A: version 1.2 of "p" and more; B: version 1.10 of "p"; the system volume: the same version."""

    def prepare(self):
        attributes = {"Tags": ["5", "6"], "Type": "org.example.drawing", "Flag": False}
        self.a = self.application("A", {
            "P.plugin": manifest("p", "1.2", attributes),
            "Own.plugin": manifest("own", Dedicated=True),
            "Guarded.plugin": manifest("guarded", VKExtensionHostEntitlement="com.example.needed"),
            "Twin.plugin": manifest("twin"),
        })
        newer = {"P.plugin": manifest("p", "1.10"), "Twin.plugin": manifest("twin", "2.0")}
        self.p, self.newer = self.a + "/PlugIns/P.plugin", self.application("B", newer) + "/PlugIns/P.plugin"
        self.on_system = self.path("System/Library/PlugIns/P.plugin")
        scratch.write(self.on_system + "/Info.vlist", manifest("p", "1.10"))
        types = {"org.example.drawing": ["org.example.picture"], "org.example.picture": ["org.example.any"]}
        scratch.write(self.path("etc/nordane/types.d/test.vlist"), {"types": types})
        self.start()

    @contextlib.contextmanager
    def one_notification(self):
        watch = self.start_zbctl("watch", "--count", "1")
        watch.stderr.readline()
        yield
        self.assertEqual(watch.communicate(timeout=DEADLINE)[0], "com.nordane.zembra.annotation-change\n")

    def test_rules(self):
        for rules, expected in (
            ("Tags=5 Tags=x", True), ("Tags=>=7", False), ("Flag=false Type", True), ("Type=?LIKE:any", False),
            ("Type=?KT-CONFORMS:org.example.any", True), ("Type=?KT-IS:org.example.any", False),
            ("Type VKExtensionContainingApp=" + self.a, True), ("Type VKUserElection=1", False),
            ("Type com.nordane.uuid=" + str(self.uuid(self.p)).upper(), True),
        ):
            words = [word for rule in rules.split() for word in ("-r", rule)]
            found = names(self.zbctl_json("match", "--all-versions", *words))
            self.assertEqual(found, ["p 1.2"] if expected else [], rules)
        self.wait_for_log(r"unrecognized match operator:\?LIKE:any")
        table = self.zbctl(0, "match", "--all-versions", "--rules", "-", input='{"Tags": ["5"]}').stdout
        self.assertRegex(table, r"com\.example\.p +1\.2 +[0-9A-F-]{36}  - ")

    def test_asked_again(self):
        """At the usual level of the log, for forms are not kept where each is told of."""
        self.stop()
        self.daemon_environment["NORDANE_LOG"] = "stderr"
        self.start()

        def ask():
            return self.match(ALL_VERSIONS, rules={"VKExtensionIdentifier": "com.example.p"})

        for _ in range(4):
            self.assertEqual(names(ask()), ["p 1.10", "p 1.2"])
        self.request("annotate", uuids=[self.uuid(self.p)], annotations={"election": 1})
        for _ in range(3):
            self.assertEqual([form["annotations"] for form in ask()], [{"election": 1}] * 2)
        scratch.write(self.p + "/Info.vlist", manifest("p", "1.3"))
        self.until(lambda: names(ask()) == ["p 1.10", "p 1.3"], "the new version")
        for _ in range(3):
            self.assertEqual(names(ask()), ["p 1.10", "p 1.3"])
        self.assertEqual(self.find(self.p)["annotations"], {"election": 1})

    def test_selection(self):
        manager = self.copy_of_zbctl(self.path("manager"), "-e", MANAGER)
        entitled = self.copy_of_zbctl(self.path("entitled"), "-e", "com.example.needed")
        inside = self.copy_of_zbctl(self.a + "/host", "-e", "com.example.nothing")
        for program, options, expected in (
            (ZBCTL, [], ["p 1.10", "twin 2.0"]),
            (ZBCTL, ["--all-versions"], ["p 1.10", "p 1.2", *TWINS]),
            (ZBCTL, ["--all-versions", "--duplicates"], ["p 1.10", "p 1.10", "p 1.2", *TWINS]),
            (manager, ["--all", "--system-only"], ["guarded 1.0", "own 1.0", "p 1.10", "twin 2.0"]),
            (entitled, [], ["guarded 1.0", "p 1.10", "twin 2.0"]),
            # Its own copies come first, whatever their versions; and what is dedicated to it.
            (inside, ["--all-versions"], ["own 1.0", "p 1.2", "twin 1.0"]),
        ):
            found = self.zbctl_json("match", *options, program=program)
            self.assertEqual(names(found), expected, (program, options))
        self.wait_for_log(rf"Ignoring .* @ '{self.newer}' in favor of bundle-relative '{self.p}'")
        self.assertIn(self.on_system, [form["path"] for form in self.match()])

    def test_annotations(self):
        known, own = self.uuid(self.newer), self.a + "/PlugIns/Own.plugin"
        with self.one_notification():  # found by its path; bits 8 to 15 are hosts' own
            elected = self.request("annotate", uuids=[NOWHERE], paths=[self.p], annotations={"election": 257})
        self.assertEqual(elected, {})
        self.assertEqual(names(self.match(ALL_VERSIONS, rules={"VKUserElection": "1"})), ["p 1.10", "p 1.2"])
        with self.one_notification():
            self.assertEqual(self.request("bulk-annotate", annotations={str(known): {"color": "blue"}}), {})
        # What came before the failing one stays.
        self.assertIn("error", self.request("annotate", uuids=[known, NOWHERE], annotations={"election": 2}))
        settings = {str(self.uuid(own)): {"a": 1}, str(NOWHERE): {}}
        self.assertIn("error", self.request("bulk-annotate", annotations=settings))
        self.assertEqual(self.find(self.p)["annotations"], {"election": 2, "extension": {"color": "blue"}})
        self.assertEqual(self.find(own)["annotations"], {"extension": {"a": 1}})
        for option, election in (("--ignore", 2), ("--reset", 0)):
            self.zbctl(0, "elect", option, self.p, own)
            self.assertEqual(self.find(own)["annotations"], {"election": election, "extension": {"a": 1}})

    def test_a_hold_lasts_until_its_token_or_its_client(self):
        twin, known = self.a + "/PlugIns/Twin.plugin", self.uuid(self.p)

        def twins():
            return names(self.match(ALL_VERSIONS, rules={"VKExtensionIdentifier": "com.example.twin"}))

        with qmx.Connection(self.socket_path) as holder:
            hold = {"request": "lock", "version": 3}
            with self.one_notification():
                first = holder.request({**hold, "paths": [self.a]})["uuids"]
            second = holder.request({**hold, "paths": [twin, twin], "flags": PLUG_INS | TERMINATE})["uuids"]
            self.assertEqual(twins(), ["twin 2.0"])
            self.assertEqual(self.request("ready", uuids=[known]),
                             error(11, "access to plugin com.example.p denied: the plug-in is on hold"))
            self.assertEqual(self.request("lock", uuids=[first]), {})  # by another client than the holder
            self.assertEqual(self.request("ready", uuids=[known]), {})
            self.assertEqual(twins(), ["twin 2.0"])
            with self.one_notification():
                holder.close()
            self.wait_for_log(f"releasing plug-in hold (?i:{second}) for dead client pid {os.getpid()}")
        self.assertEqual(twins(), TWINS)

    def test_zbctls_hold_lasts_as_long_as_its_command_and_the_daemon(self):
        for status, *command in ((7, "sh", "-c", "exit 7"), (137, "sh", "-c", "kill -9 $$"), (127, "/nowhere")):
            self.zbctl(status, "hold", self.a, "--", *command)
            self.assertEqual(names(self.match(ALL_VERSIONS, rules={"Tags": True})), ["p 1.2"])
        holder = self.start_zbctl("hold", "--plug-in", self.p)
        holder.stderr.readline()
        self.kill()
        self.assertEqual(holder.wait(DEADLINE), 3)


if __name__ == "__main__":
    unittest.main()
