#!/usr/bin/env python3
"""What peers may throw at the daemon: in every case a clear error or a closed connection, and others are served on."""

import os
import select
import signal
import socket
import struct
import subprocess
import sys
import threading
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

    def assert_refused(self, peer):
        peer.settimeout(60)
        try:
            self.assertEqual(peer.recv(1), b"")
        except ConnectionResetError:
            pass  # the daemon had not read all of it

    def test_malformed_frames_close_the_connection(self):
        good = qmx.encode(BULK)
        entry = struct.pack("<I", 1) + b"a" + qmx.encode(1)
        cases = {
            "unknown type": struct.pack("<IB3xQ", 12 + len(good), 9, 1) + good,
            "reserved bytes": struct.pack("<IBBHQ", 12 + len(good), 1, 1, 0, 1) + good,
            "too long": struct.pack("<I", (64 << 20) + 1),
            "length beyond belief": struct.pack("<I", 0xFFFFFFFF),
            "too short": struct.pack("<I", 3) + b"abc",
            "no body": struct.pack("<IB3xQ", 12, 1, 1),
            "reply to nobody": qmx.frame(qmx.REPLY, 77, good),
            "unknown tag": qmx.frame(1, 1, b"\xff"),
            "truncated value": qmx.frame(1, 1, good[:-3]),
            "bytes left over": qmx.frame(1, 1, good + b"\x01"),
            "count beyond the size": qmx.frame(1, 1, b"\x0a" + struct.pack("<II", 0, 0xFFFFFFFF)),
            "size beyond the body": qmx.frame(1, 1, b"\x0a" + struct.pack("<II", 0xFFFFFFFF, 1) + b"\x01"),
            "string beyond the body": qmx.frame(1, 1, b"\x07" + struct.pack("<I", 0x7FFFFFFF) + b"abc"),
            "ill-formed text": qmx.frame(1, 1, b"\x07" + struct.pack("<I", 2) + b"\xc0\x80"),
            "NUL in text": qmx.frame(1, 1, b"\x07" + struct.pack("<I", 2) + b"a\0"),
            "duplicate key": qmx.frame(1, 1, b"\x0b" + struct.pack("<II", 2 * len(entry), 2) + entry + entry),
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

    def test_one_byte_at_a_time(self):
        with self.connect() as connection:
            for byte in qmx.frame(1, 5, qmx.encode(self.find)):
                connection.send_bytes(bytes([byte]))
            number, reply = connection.receive()
            self.assertEqual(number, 5)
            self.assertIn("matches", reply)

    def test_a_truncated_frame_and_then_nothing(self):
        for cut in (1, 4, 15, 20):
            with self.connect() as connection:
                connection.send_bytes(qmx.frame(1, 1, qmx.encode(BULK))[:cut])
        self.assert_serves()

    def test_a_peer_that_never_reads_stops_only_itself(self):
        with self.connect() as connection:
            connection.socket.setblocking(False)
            frame = qmx.frame
            sent = 0
            number = 0
            # 100 KB of reply each: the daemon stops reading long before 3,000 of them would have to be kept.
            while sent < 3000 and select.select([], [connection.socket], [], 2)[1]:
                number += 1
                try:
                    connection.socket.send(frame(1, number, qmx.encode(self.find)))
                except BlockingIOError:
                    break
                sent += 1
            self.assertLess(sent, 3000)
            with open(f"/proc/{self.platform.process.pid}/status", encoding="ascii") as status:
                resident = int(next(line for line in status if line.startswith("VmRSS")).split()[1])
            self.assertLess(resident, 2_000_000)
            self.assert_serves()
        self.assert_serves()

    def test_silent_peers_cost_nothing(self):
        silent = [qmx.connect_socket(self.platform.socket_path) for _ in range(50)]
        with self.connect():
            self.assert_serves()
        for peer in silent:
            peer.close()

    def test_a_peer_that_dies_between_request_and_reply(self):
        code = ("import os, sys; sys.path.insert(0, sys.argv[1]); import qmx\n"
                "c = qmx.Connection(sys.argv[2])\n"
                "for i in range(200): c.send({'request': 'bulk', 'version': 3})\n"
                "os.kill(os.getpid(), 9)")
        for _ in range(10):
            done = subprocess.run([sys.executable, "-B", "-c", code, os.path.dirname(__file__), self.platform.socket_path],
                                  check=False)
            self.assertEqual(done.returncode, -signal.SIGKILL)
        self.assert_serves()

    def test_half_closed_peers_get_their_replies(self):
        with self.connect() as connection:
            numbers = [connection.send(BULK) for _ in range(100)]
            connection.shut_down_sending()
            self.assertEqual([connection.receive()[0] for _ in numbers], numbers)

    def test_a_wrong_or_foreign_handshake_is_refused(self):
        greeting_length = 24
        cases = {"wrong nonce": lambda greeting: b"qmxc\x01\0\0\0" + b"\0" * 16,
                 "the greeting itself": lambda greeting: greeting,
                 "another protocol": lambda greeting: b"GET / HTTP/1.1\r\n\r\n" + b" " * 40}
        for name, answer in cases.items():
            with self.subTest(name), qmx.connect_socket(self.platform.socket_path) as peer:
                greeting = peer.recv(greeting_length, socket.MSG_WAITALL)
                peer.sendall(answer(greeting))
                self.assert_refused(peer)
        # A child that was handed the socket cannot speak for its parent.
        with qmx.connect_socket(self.platform.socket_path) as peer:
            greeting = peer.recv(greeting_length, socket.MSG_WAITALL)
            child = os.fork()
            if child == 0:
                peer.sendall(b"qmxc\x01\0\0\0" + bytes(byte ^ 0xFF for byte in greeting[8:]))
                os._exit(0)
            os.waitpid(child, 0)
            self.assert_refused(peer)

    def test_two_thousand_connections_of_one_user(self):
        peers, refused = [], 0
        for _ in range(2000):
            try:
                peers.append(qmx.Connection(self.platform.socket_path))
            except ConnectionError:
                refused += 1
        self.assertGreater(len(peers), 500)
        self.assertGreater(refused, 500)
        for peer in (peers[0], peers[-1]):
            self.assertEqual(peer.request(BULK), {})
        if os.geteuid() == 0:  # another user is not locked out
            done = subprocess.run(
                ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", sys.executable, "-B", "-c",
                 "import sys; sys.path.insert(0, '/dev/fd/3'); exec(sys.stdin.read())"],
                input=self.foreign_client(), text=True, check=False, capture_output=True)
            self.assertEqual(done.returncode, 0, done.stderr)
        for peer in peers:
            peer.close()
        # The places are free again as soon as the daemon has seen the ends.
        self.platform.wait_for_log(rf"client {os.getpid()} is dead", len(peers))
        self.assert_serves()

    def foreign_client(self):
        """The source of a client that needs nothing of the file system but the socket."""
        with open(qmx.__file__, encoding="utf-8") as source:
            text = source.read()
        os.chmod(self.platform.directory, 0o755)
        return text + f"\nassert Connection({self.platform.socket_path!r}).request({BULK!r}) == {{}}\n"

    def test_many_clients_at_once_each_get_their_own_replies(self):
        failures = []

        def work(index):
            try:
                with self.connect() as connection:
                    for i in range(200):
                        message = self.find if i % 2 else {"request": f"{index}-{i}", "version": 3}
                        reply = connection.request(message)
                        if ("matches" in reply) != bool(i % 2):
                            failures.append((index, i, reply))
            except Exception as error:  # a failure must reach the main thread
                failures.append((index, error))

        threads = [threading.Thread(target=work, args=(index,)) for index in range(16)]
        for thread in threads:
            thread.start()
        for thread in threads:
            thread.join()
        self.assertEqual(failures, [])


if __name__ == "__main__":
    unittest.main()
