#!/usr/bin/env python3
"""What peers may throw at the daemon: in every case a clear error or a closed connection, and others are served on."""

import ast
import concurrent.futures
import os
import select
import signal
import struct
import subprocess
import sys
import unittest
import uuid

import bundles
import qmx
import scratch

BULK = {"request": "bulk", "version": 3}


def nested(depth):
    body = qmx.encode(1)
    for _ in range(depth):
        body = b"\x0a" + struct.pack("<II", len(body), 1) + body
    return body


class HostileTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.platform = scratch.Platform(samples=False)
        cls.addClassCleanup(cls.platform.__exit__, None, None, None)
        app = bundles.application(cls.platform.root, "Paper", {
            "Data.plugin": bundles.manifest("com.example.data", filling="x" * 100_000)})
        cls.platform.start()
        with cls.connect() as connection:
            path = "file://" + bundles.plugin_path(app, "Data.plugin")
            form = connection.request({"request": "find", "version": 3, "paths": path})["matches"]
            cls.find = {"request": "find", "version": 3, "uuids": uuid.UUID(qmx.decode_matches(form)["uuid"])}

    @classmethod
    def tearDownClass(cls):
        cls.platform.stop()

    @classmethod
    def connect(cls):
        return qmx.Connection(cls.platform.socket_path)

    def assert_serves(self):
        with self.connect() as connection:
            self.assertEqual(connection.request(BULK), {})

    def test_malformed_frames_close_the_connection(self):
        good = qmx.encode(BULK)
        # The decoder's own tests have every kind; here are those that could hurt a process.
        cases = {
            "unknown type": struct.pack("<IB3xQ", 12 + len(good), 9, 1) + good,
            "length beyond belief": struct.pack("<I", 0xFFFFFFFF),
            "too short": struct.pack("<I", 3) + b"abc",
            "reply to nobody": qmx.frame(qmx.REPLY, 77, good),
            "truncated value": qmx.frame(1, 1, good[:-3]),
            "count beyond the size": qmx.frame(1, 1, b"\x0a" + struct.pack("<II", 0, 0xFFFFFFFF)),
            "size beyond the body": qmx.frame(1, 1, b"\x0a" + struct.pack("<II", 0xFFFFFFFF, 1) + b"\x01"),
            "nested too deeply": qmx.frame(1, 1, nested(65)),
            "nested beyond any stack": qmx.frame(1, 1, nested(100_000)),
        }
        for name, data in cases.items():
            with self.subTest(name), self.connect() as connection:
                try:
                    connection.send_bytes(data)
                    while True:
                        connection.receive()
                except ConnectionError:
                    pass  # what came before may be answered; then the connection ends
                self.assert_serves()

    def test_what_is_only_large_is_served(self):
        with self.connect() as connection:
            number = connection.send({**BULK, "fill": "x" * (60 << 20)})
            self.assertEqual(connection.receive(), (number, {}))
            connection.send_bytes(qmx.frame(1, 900, nested(64)))
            self.assertEqual(connection.request(BULK), {})
            rules = {f"key{i}": i for i in range(100_000)}
            self.assertEqual(connection.request({**BULK, "rules": rules}), {})

    def test_wrong_types_are_answered_in_the_protocols_terms(self):
        wrong = [0, -1, 2**64 - 1, 1.5, True, "text", b"data", [], [[]], {}, {"a": {}}, uuid.UUID(int=0)]
        with self.connect() as connection:
            for kind in ("add", "remove", "bulk", "match", "ready", "access", "annotate", "bulk-annotate", "lock", "find"):
                for key in ("paths", "uuids", "flags", "rules", "annotations", "environment"):
                    for value in wrong:
                        if kind == "add" and key == "paths" and value == []:
                            continue
                        reply = connection.request({"request": kind, "version": 3, key: value})
                        self.assertTrue(reply.get("errorcode", 1) != 0)
        self.assert_serves()

    def test_a_peer_that_never_reads_stops_only_itself(self):
        with self.connect() as connection:
            sent = 0
            # 100 KB of reply each: the daemon stops reading long before 3,000 of them would have to be kept.
            while sent < 3000 and select.select([], [connection.socket], [], 2)[1]:
                try:
                    connection.socket.send(qmx.frame(1, sent + 1, qmx.encode(self.find)))
                except BlockingIOError:
                    break
                sent += 1
            self.assertLess(sent, 3000)
            with open(f"/proc/{self.platform.process.pid}/status", encoding="ascii") as status:
                resident = int(next(line for line in status if line.startswith("VmRSS")).split()[1])
            self.assertLess(resident, 2_000_000)
            self.assert_serves()
        self.assert_serves()

    def test_silent_and_interrupted_peers_cost_nothing(self):
        silent = [qmx.connect_socket(self.platform.socket_path) for _ in range(50)]
        for cut in (1, 4, 15, 20):
            with self.connect() as connection:
                connection.send_bytes(qmx.frame(1, 1, qmx.encode(BULK))[:cut])
        self.assert_serves()
        for peer in silent:
            peer.close()

    def test_a_peer_that_dies_between_request_and_reply(self):
        code = ("import sys; sys.path.insert(0, sys.argv[1]); import os, qmx\n"
                "c = qmx.Connection(sys.argv[2])\n"
                "for i in range(200): c.send({'request': 'bulk', 'version': 3})\n"
                "os.kill(os.getpid(), 9)")
        for _ in range(10):
            done = subprocess.run([sys.executable, "-B", "-c", code, os.path.dirname(__file__), self.platform.socket_path],
                                  check=False)
            self.assertEqual(done.returncode, -signal.SIGKILL)
        self.assert_serves()

    def test_one_users_connections_lock_no_other_user_out(self):
        peers = []
        with self.assertRaises(ConnectionError):
            while len(peers) < 2000:
                peers.append(self.connect())
        self.assertGreater(len(peers), 500)
        for peer in (peers[0], peers[-1]):
            self.assertEqual(peer.request(BULK), {})
        if os.geteuid() == 0:
            self.assertEqual(self.ask_as_another_user([BULK]), [{}])
        for peer in peers:
            peer.close()
        # The places are free again as soon as the daemon has seen the ends.
        self.platform.wait_for_log(rf"client {os.getpid()} is dead", len(peers))
        self.assert_serves()

    def ask_as_another_user(self, requests):
        """The replies to a client of user nobody, who needs nothing of the file system but the socket."""
        with open(qmx.__file__, encoding="utf-8") as source:
            code = source.read() + f"""
with Connection({self.platform.socket_path!r}) as connection:
    print([connection.request(request) for request in {requests!r}])"""
        os.chmod(self.platform.directory, 0o755)
        done = subprocess.run(["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", sys.executable, "-B", "-"],
                              input=code, text=True, check=False, capture_output=True)
        self.assertEqual(done.returncode, 0, done.stderr)
        return ast.literal_eval(done.stdout)

    @unittest.skipUnless(os.geteuid() == 0, "for root's daemon")
    def test_another_user_learns_and_registers_only_what_is_theirs_to_read(self):
        elsewhere = self.platform.path("elsewhere/")
        inside, shut, free = (elsewhere + name for name in ("closed/A.plugin", "Shut.plugin", "Free.plugin"))
        for bundle in (inside, shut, free):
            bundles.write(bundle + "/Info.vlist", bundles.manifest("com.example." + os.path.basename(bundle)))
        os.chmod(elsewhere + "closed", 0o700)
        os.chmod(shut + "/Info.vlist", 0o600)
        os.symlink(elsewhere + "closed", elsewhere + "link")
        behind = elsewhere + "closed/../../Applications/Paper.app/PlugIns/Data.plugin"
        unseen = [inside, elsewhere + "closed/missing", elsewhere + "link/A.plugin",
                  f"/proc/{self.platform.process.pid}/cwd"]
        cases = [("add", path, {"errorcode": 9, "error": "invalid plugin path: " + path}) for path in unseen]
        cases += [("add", shut, {"errorcode": 2, "error": "unable to register plug-in at " + shut}), ("add", free, {}),
                  # Locations are taken as written, so nobody tells by them whether "closed" is there.
                  ("find", behind, {"errorcode": 15, "error": "Cannot locate PlugIn"})]
        replies = self.ask_as_another_user(
            [{"request": kind, "version": 3, "paths": "file://" + path if kind == "find" else [path]}
             for kind, path, _ in cases])
        for (kind, path, expected), reply in zip(cases, replies, strict=True):
            self.assertEqual(reply, expected, (kind, path))
        with self.connect() as connection:
            self.assertEqual(connection.request({"request": "add", "version": 3, "paths": [inside, shut]}), {})

    def test_many_clients_at_once_each_get_their_own_replies(self):
        def work(index):
            with self.connect() as connection:
                for i in range(200):
                    reply = connection.request(self.find if i % 2 else {"request": f"{index}-{i}", "version": 3})
                    self.assertEqual("matches" in reply, bool(i % 2))

        with concurrent.futures.ThreadPoolExecutor(16) as pool:
            list(pool.map(work, range(16)))  # raises what a thread raised


if __name__ == "__main__":
    unittest.main()
