"""What peers may throw at the daemon: a clear error or a closed connection, and others are served on."""

import ast
import os
import struct
import sys
import time
import unittest
import uuid

import qmx
import scratch
from scratch import error, manifest

KINDS = ("add", "remove", "bulk", "find", "match", "ready", "access", "annotate", "bulk-annotate", "lock")
WRONG = (0, -1, 2**64 - 1, 1.5, float("nan"), True, "text", b"data", [[]], {}, {"a": {}}, uuid.UUID(int=0))
VALUES = {f"Values{n}": [f"value{i}.{i}" for i in range(n)] for n in (2_500, 10_000)}
OPERATORS = ("=", "", "<!", "<=!", ">~", ">=~", "?KT-IS:", "?KT-CONFORMS:", "?X:")  # none fits a value
DIGITS = "1" * 150_000 + "0" * 150_000


def nested(depth):
    return b"".join(struct.pack("<BII", 10, 9 * rest + 1, 1) for rest in reversed(range(depth))) + b"\x01"


class Messages(scratch.Case):
    def prepare(self):
        self.application("Paper", {"Data.plugin": manifest("data")})
        self.start()

    def test_malformed_values_end_their_connection_and_large_ones_are_served(self):
        for body in (b"", struct.pack("<BII", 10, 0xFFFFFFFF, 0xFFFFFFFF), nested(65), nested(100_000)):
            with qmx.Connection(self.socket_path) as connection:
                with self.assertRaises(ConnectionError, msg=body[:40]):
                    connection.send_bytes(qmx.frame(qmx.REQUEST, 1, body))
                    connection.receive()
        with qmx.Connection(self.socket_path) as connection:
            connection.send_bytes(qmx.frame(qmx.REQUEST, 1, nested(64)))  # no dictionary, so without a reply
            for value in ("x" * (60 << 20), {f"key{i}": i for i in range(100_000)}):
                self.assertEqual(connection.request({"request": "bulk", "version": 3, "x": value}), {})

    def test_wrong_types_are_answered(self):
        with qmx.Connection(self.socket_path) as connection:
            for kind in KINDS:
                for key in ("paths", "uuids", "flags", "rules", "annotations", "environment"):
                    for value in WRONG:
                        reply = connection.request({"request": kind, "version": 3, key: value})
                        self.assertIn(reply.get("errorcode", 4), (4, 9, 11, 15, 18), (kind, key, value))

    @unittest.skipUnless(os.geteuid() == 0, "for root's daemon")
    def test_another_user_is_served_and_learns_and_registers_only_what_is_theirs_to_read(self):
        elsewhere = self.path("elsewhere/")
        inside, shut, free = (elsewhere + name for name in ("closed/A.plugin", "Shut.plugin", "Free.plugin"))
        for bundle in (inside, shut, free):
            scratch.write(bundle + "/Info.vlist", manifest(os.path.basename(bundle)))
        os.chmod(elsewhere + "closed", 0o700)
        os.chmod(shut + "/Info.vlist", 0o600)
        os.symlink(elsewhere + "closed", elsewhere + "link")
        # Locations are taken as written, so nobody tells by them whether "closed" is there.
        behind = "file://" + elsewhere + "closed/../../Applications/Paper.app/PlugIns/Data.plugin"
        unseen = (inside, elsewhere + "closed/missing", elsewhere + "link/A.plugin",
                  f"/proc/{self.process.pid}/cwd")
        requests = [{"request": "add", "version": 3, "paths": [path]} for path in (*unseen, shut, free)]
        requests.append({"request": "find", "version": 3, "paths": behind})
        with open(qmx.__file__, encoding="utf-8") as source:  # that user can read no file of the tests
            code = source.read() + f"""
with Connection({self.socket_path!r}) as connection:
    print([connection.request(request) for request in {requests!r}])"""
        os.chmod(self.directory, 0o755)
        peers = []
        with self.assertRaises(ConnectionError):  # one user's connections lock no other one out
            while len(peers) < 2000:
                peers.append(qmx.Connection(self.socket_path))
        done = self.run_program("setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                                sys.executable, "-B", "-", input=code)
        for peer in peers:
            peer.close()
        self.assertEqual(done.returncode, 0, done.stderr)
        expected = [*(error(9, "invalid plugin path: " + path) for path in unseen),
                    error(2, "unable to register plug-in at " + shut), {}, error(15, "Cannot locate PlugIn")]
        self.assertEqual(ast.literal_eval(done.stdout), expected)
        self.wait_for_log(rf"client {os.getpid()} is dead", len(peers))  # so that there is room again
        self.assertEqual(self.request("add", paths=[inside, shut]), {})


class Rules(scratch.Case):
    """Rules that are out of all proportion: the right answer, at a cost that grows as they do."""

    def prepare(self):
        attributes = {**VALUES, "Digits": DIGITS, "Type": "org.example.type"}
        self.application("Paper", {"Many.plugin": manifest("many", "1.0", attributes)})
        # Whoever compares each rule with each plug-in shows it here.
        self.application("Others", {f"{i}.plugin": manifest(f"other{i}") for i in range(20)})
        self.daemon_environment["NORDANE_LOG"] = "error,private,stderr"  # debug lines show whole requests
        self.start()

    def test_large_rules_are_answered_right(self):
        for rules, expected in (
            ({f"key{i}": False for i in range(20_000)}, 21),
            ({"Values10000": [f"x{i}" for i in range(9_999)] + ["value9999.9999"]}, 1),
            ({"Values10000": [operator + str(i) for i in range(1_000) for operator in OPERATORS]}, 0),
            ({"Values10000": WRONG * 1_000}, 0),
            ({"Digits": "=" + "0" * 1_000_000 + DIGITS}, 1),
            ({"Digits": ">=" + DIGITS[:-1] + "1"}, 0),
            ({"Type": "?KT-CONFORMS:" + "x." * 1_000_000}, 0),
        ):
            self.assertEqual(len(self.match(1, rules=rules)), expected, str(rules)[:100])

    def cost(self, rules):
        """Of asking, in the daemon's processor time: the least of some, as other things take time as well."""
        clock = ~self.process.pid << 3 | 2  # as clock_getcpuclockid() answers it
        costs = []
        for _ in range(5):
            start = time.clock_gettime(clock)
            self.assertEqual(self.match(rules=rules), [])
            costs.append(time.clock_gettime(clock) - start)
        return min(costs)

    def test_the_cost_grows_as_the_rules_do(self):
        for name, size, make in (
            ("entries", 25_000, lambda n: {**{f"key{i}": False for i in range(n)}, "Nothing": "x"}),
            ("patterns and values", 2_500, lambda n: {f"Values{n}": [f"x{i}" for i in range(n)]}),
            ("bounds and values", 2_500, lambda n: {f"Values{n}": [f"<a{i}" for i in range(n)]}),
            ("digits", 250_000, lambda n: {"Digits": "=" + "1" * n}),
        ):
            small, large = self.cost(make(size)), self.cost(make(4 * size))
            self.assertLess(large, 8 * small, name)


if __name__ == "__main__":
    unittest.main()
