"""What peers may throw at the daemon: a clear error or a closed connection, and others are served on."""

import ast
import contextlib
import itertools
import os
import socket
import struct
import sys
import time
import unittest
import uuid
from pathlib import Path

import qmx
import scratch
from scratch import error, manifest

KINDS = ("add", "remove", "bulk", "find", "match", "ready", "access", "annotate", "bulk-annotate", "lock")
KEYS = ("paths", "uuids", "flags", "rules", "annotations", "environment")
WRONG = (0, -1, 2**64 - 1, 1.5, float("nan"), True, "text", b"data", [[]], {}, {"a": {}}, uuid.UUID(int=0))
VALUES = {n: [f"value{i}.{i}" for i in range(n)] for n in (2_500, 10_000)}
OPERATORS = ("=", "", "<!", "<=!", ">~", ">=~", "?KT-IS:", "?KT-CONFORMS:", "?X:")  # none fits a value
DIGITS = "1" * 150_000 + "0" * 150_000


def nested(depth):
    return b"".join(struct.pack("<BII", 10, 9 * rest + 1, 1) for rest in reversed(range(depth))) + b"\x01"


class Messages(scratch.Case):
    def prepare(self):
        self.application("Paper", {"Data.plugin": manifest("data")})
        self.start()

    def test_malformed_values_end_their_connection_and_large_ones_are_served(self):
        bodies = (b"", b"\x07\5\0\0\0cut", b"\x07\1\0\0\0\xff", b"\x0b\x0c\0\0\0\2\0\0\0" + b"\1\0\0\0k\1" * 2,
                  struct.pack("<BII", 10, 0xFFFFFFFF, 0xFFFFFFFF), nested(65), nested(100_000))
        too_long = struct.pack("<IB3xQ", (64 << 20) + 1, qmx.REQUEST, 1)
        for data in (too_long, *(qmx.frame(qmx.REQUEST, 1, body) for body in bodies)):
            with qmx.Connection(self.socket_path) as connection:
                with self.assertRaises(ConnectionError, msg=data[:40]):
                    connection.socket.sendall(data)
                    connection.receive()
        with qmx.Connection(self.socket_path) as connection:
            connection.socket.sendall(qmx.frame(qmx.REQUEST, 1, nested(64)))  # no dictionary, so without a reply
            for value in ("x" * (60 << 20), {f"key{i}": i for i in range(100_000)}):
                self.assertEqual(connection.request({"request": "bulk", "version": 3, "x": value}), {})

    def test_peers_that_stand_still_or_end_hold_up_nobody(self):
        match = qmx.frame(qmx.REQUEST, 1, qmx.encode({"request": "match", "version": 3}))
        with (socket.socket(socket.AF_UNIX) as silent, qmx.Connection(self.socket_path) as deaf,
              qmx.Connection(self.socket_path) as slow):
            silent.connect(self.socket_path)
            deaf.socket.setblocking(False)
            with self.assertRaises(BlockingIOError):
                while True:
                    deaf.send({"request": "match", "version": 3})
            for ended in range(1, len(match)):
                with qmx.Connection(self.socket_path) as connection:
                    connection.socket.sendall(match + match[:ended])
            for byte in match:
                self.assertEqual(self.request("bulk"), {})
                slow.socket.sendall(bytes([byte]))
            self.assertEqual(len(qmx.decode(slow.receive()[1]["matches"])), 1)

    def test_wrong_types_are_answered(self):
        with qmx.Connection(self.socket_path) as connection:
            for kind, key, value in itertools.product(KINDS, KEYS, WRONG):
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
        # That user can read no file of the tests.
        code = Path(qmx.__file__).read_text() + f"""
with Connection({self.socket_path!r}) as connection:
    print([connection.request(request) for request in {requests!r}])"""
        os.chmod(self.directory, 0o755)
        with contextlib.ExitStack() as peers:
            with self.assertRaises(ConnectionError):  # one user's connections lock no other one out
                for count in range(2000):
                    peers.enter_context(qmx.Connection(self.socket_path))
            done = self.run_program("setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                                    sys.executable, "-B", "-", input=code)
        self.assertEqual(done.returncode, 0, done.stderr)
        expected = [*(error(9, "invalid plugin path: " + path) for path in unseen),
                    error(2, "unable to register plug-in at " + shut), {}, error(15, "Cannot locate PlugIn")]
        self.assertEqual(ast.literal_eval(done.stdout), expected)
        self.wait_for_log(rf"client {os.getpid()} is dead", count)  # so that there is room again
        self.assertEqual(self.request("add", paths=[inside, shut]), {})


class Rules(scratch.Case):
    """Rules that are out of all proportion."""

    def prepare(self):
        many, more = ({key + str(n): VALUES[n] for n in VALUES} for key in ("Values", "More"))
        many |= {"Digits": DIGITS, "Type": "org.example.type"}
        self.application("Paper", {"1.plugin": manifest("1", "1.0", many), "2.plugin": manifest("2", "1.0", more)})
        self.application("Others", {f"{i}.plugin": manifest(f"other{i}") for i in range(3)})
        self.daemon_environment["NORDANE_LOG"] = "error,private,stderr"  # debug lines show whole requests
        self.start()

    def cost(self, rules, expected):
        """Of asking, in the daemon's processor time: the least of some, as other things take time as well."""
        clock = ~self.process.pid << 3 | 2  # as clock_getcpuclockid() answers it
        costs = []
        for _ in range(5):
            start = time.clock_gettime(clock)
            self.assertEqual(len(self.match(1, rules=rules)), expected, str(rules)[:100])
            costs.append(time.clock_gettime(clock) - start)
        return min(costs)

    def test_answers_are_right_at_a_cost_that_grows_no_faster_than_the_rules(self):
        for size, expected, make in (
            (25_000, 5, lambda n: {f"key{i}": False for i in range(n)}),
            (2_500, 1, lambda n: {f"Values{n}": [f"x{i}" for i in range(n - 1)] + [f"value{n - 1}.{n - 1}"]}),
            (2_500, 0, lambda n: {key + str(n): VALUES.get(n) for key in ("Values", "More")}),
            (2_500, 0, lambda n: {f"Values{n}": [f"<a{i}" for i in range(n)]}),
            (2_500, 0, lambda n: {f"Values{n}": [OPERATORS[i % 9] + str(i) for i in range(n)]}),
            (2_500, 0, lambda n: {f"Values{n}": [WRONG[i % 12] for i in range(n)]}),
            (250_000, 1, lambda n: {"Digits": "=" + "0" * n + DIGITS}),
            (250_000, 0, lambda n: {"Digits": ">=" + "0" * n + DIGITS[:-1] + "1"}),
            (250_000, 0, lambda n: {"Type": "?KT-CONFORMS:" + "x." * n}),
        ):
            small, large = self.cost(make(size), expected), self.cost(make(4 * size), expected)
            self.assertLess(large, 8 * small, str(make(1)))


if __name__ == "__main__":
    unittest.main()
