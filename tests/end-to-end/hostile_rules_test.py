#!/usr/bin/env python3
"""Rules that are out of all proportion: the right answer or a clear error, at a cost that grows as the rules do."""

import unittest

import bundles
import qmx
import scratch

VALUES = {f"Values{n}": [f"value{i}.{i}" for i in range(n)] for n in (2_500, 10_000)}
OPERATORS = ("=", "", "<!", "<=!", ">~", ">=~", "?KT-IS:", "?KT-CONFORMS:", "?X:")  # with operands beyond all values
DIGITS = "1" * 150_000 + "0" * 150_000


class HostileRulesTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.platform = scratch.Platform(samples=False)
        cls.addClassCleanup(cls.platform.__exit__, None, None, None)
        bundles.application(cls.platform.root, "Paper", {"Many.plugin": bundles.manifest("com.example.many", VKExtensionAttributes={
            "VKExtensionVersion": "1.0", **VALUES, "Digits": DIGITS, "Type": "org.example.type"})})
        # Whoever compares each rule with each plug-in shows it here.
        bundles.application(cls.platform.root, "Others", {
            f"{i}.plugin": bundles.manifest(f"com.example.other{i}") for i in range(20)})
        cls.platform.environment["NORDANE_LOG"] = "error,private,stderr"  # debug lines show whole requests
        cls.platform.start()
        cls.other = qmx.Connection(cls.platform.socket_path)
        cls.addClassCleanup(cls.other.close)

    @classmethod
    def tearDownClass(cls):
        cls.platform.stop()

    def match(self, rules):
        """The names of the plug-ins that fulfil the rules, or the error; and others are served on."""
        with qmx.Connection(self.platform.socket_path) as connection:
            reply = connection.request({"request": "match", "version": 3, "flags": 1, "rules": rules})
        self.assertEqual(self.other.request({"request": "bulk", "version": 3}), {})
        if "errorcode" in reply:
            return reply["errorcode"], reply["error"]
        return sorted(form["identifier"].removeprefix("com.example.") for form in qmx.decode_matches(reply["matches"]))

    def processor_time(self):
        with open(f"/proc/{self.platform.process.pid}/stat", encoding="ascii") as stat:
            fields = stat.read().rsplit(")", 1)[1].split()
        return int(fields[11]) + int(fields[12])

    def cost(self, rules, times):
        """Of asking so many times, in the daemon's clock ticks."""
        body = qmx.encode({"request": "match", "version": 3, "rules": rules})
        before = self.processor_time()
        with qmx.Connection(self.platform.socket_path) as connection:
            for number in range(times):
                connection.send_bytes(qmx.frame(qmx.REQUEST, number, body))
                self.assertEqual(qmx.decode_matches(connection.receive()[1]["matches"]), [])
        return self.processor_time() - before

    def test_large_rules_are_answered_right(self):
        cases = {
            "all absent, as asked": ({f"key{i}": False for i in range(100_000)}, 21),
            "all absent but asked for": ({f"key{i}": "1" for i in range(100_000)}, 0),
            "the last one fits": ({"Values10000": [f"x{i}" for i in range(9_999)] + ["value9999.9999"]}, 1),
            "none fits": ({"Values10000": [f"x{i}" for i in range(10_000)]}, 0),
            "every operator": ({"Values10000": [operator + str(i) for i in range(1_000) for operator in OPERATORS]}, 0),
            "nothing that is a pattern": ({"Values10000": [[], {}, 1, True] * 10_000}, 0),
            "all but one value": ({"Values10000": ["<>value0.0"] * 10_000}, 1),
            "equal numbers of a million digits": ({"Digits": "=" + "0" * 1_000_000 + DIGITS}, 1),
            "less than one more": ({"Digits": "<" + DIGITS[:-1] + "1"}, 1),
            "not before one more": ({"Digits": ">=" + DIGITS[:-1] + "1"}, 0),
            "a million digits against few": ({"VKExtensionVersion": "<" + "9" * 1_000_000}, 21),
            "unknown operators": ({"Type": ["?KT-UNKNOWN:org.example.type", "?", "??", "?KT-IS"]}, 0),
            "a long type": ({"Type": "?KT-CONFORMS:" + "x." * 1_000_000}, 0),
            "a long key": ({"k" * 1_000_000: False}, 21),
        }
        for name, (rules, expected) in cases.items():
            with self.subTest(name):
                self.assertEqual(len(self.match(rules)), expected)

    def test_wrong_types_fit_nothing(self):
        wrong = [0, -1, 2**64 - 1, float("nan"), float("inf"), b"1.0", [], [[]], [[["1.0"]]], {}, {"a": {"b": []}}, [1, 2.5, b"x", {}, []]]
        for key in ("VKExtensionVersion", "VKUserElection", "VKExtensionIdentifier", "com.nordane.uuid", "ENTITLEMENT:x",
                    "VKExtensionContainingApp", "Values10000", ""):
            for value in wrong:
                with self.subTest(f"{key} {str(value)[:40]}"):
                    # The number 0 asks for what is absent.
                    absent = {"Values10000": 20, "ENTITLEMENT:x": 21, "": 21}.get(key, 0)
                    self.assertEqual(len(self.match({key: value})), absent if value == 0 else 0)
        for rules in (0, "x", [], [{}], b"", True):
            self.assertEqual(self.match(rules), (4, "invalid request format (bad rules dictionary)"))

    def test_the_cost_grows_as_the_rules_do(self):
        cases = {
            "entries": (25_000, lambda n: {**{f"key{i}": False for i in range(n)}, "Nothing": "x"}),
            "patterns and values": (2_500, lambda n: {f"Values{n}": [f"x{i}" for i in range(n)]}),
            "bounds and values": (2_500, lambda n: {f"Values{n}": [f"<a{i}" for i in range(n)]}),
            "digits": (250_000, lambda n: {"Digits": "=" + "1" * n}),
        }
        for name, (size, make) in cases.items():
            with self.subTest(name):
                times = 1
                # Ticks are coarse, so the small one is repeated until it takes some.
                while (small := self.cost(make(size), times)) < 10 and times < 256:
                    times *= 2
                large = self.cost(make(4 * size), times)
                self.assertLess(large, 8 * max(small, 10), f"{times} times; {small} ticks before")


if __name__ == "__main__":
    unittest.main()
