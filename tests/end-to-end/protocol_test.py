#!/usr/bin/env python3
"""Every reply of the requests that the daemon serves, asked for by a client that shares no code with it."""

import os
import shutil
import unittest
import uuid

import bundles
import qmx
import scratch

FORM_KEYS = {"hubProtocolVersion", "path", "systemResident", "identifier", "original-identifier", "version",
             "bundleInfo", "info", "uuid", "lastmodified", "annotations", "localizedFilevaneActionNames"}


class ProtocolTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.platform = scratch.Platform(samples=False)
        cls.addClassCleanup(cls.platform.__exit__, None, None, None)
        cls.app = bundles.application(cls.platform.root, "Paper", {
            "Data.plugin": bundles.manifest("com.example.data", Shared=["."]),
            "Other.plugin": bundles.manifest("com.example.other"),
        })
        cls.data = bundles.plugin_path(cls.app, "Data.plugin")
        cls.other = bundles.plugin_path(cls.app, "Other.plugin")
        cls.platform.start()

    @classmethod
    def tearDownClass(cls):
        cls.platform.stop()

    def request(self, message, version=3):
        if version is not None:
            message = {**message, "version": version}
        with qmx.Connection(self.platform.socket_path) as connection:
            return connection.request(message)

    def form(self, path):
        return qmx.decode_matches(self.request({"request": "find", "paths": "file://" + path})["matches"])

    def assert_error(self, reply, code, text):
        self.assertEqual((reply.get("errorcode"), reply.get("error")), (code, text))
        self.assertNotIn("matches", reply)

    def test_versions(self):
        for version in (0, 1, 4, 2**63, 2**64 - 1):
            self.assertEqual(self.request({"request": "bulk"}, version)["errorcode"], 7)
        self.assert_error(self.request({"request": "bulk"}, 4), 7, "unsupported protocol version 4 (current 3)")
        for version in (None, "3", -3, 3.0, True):  # what is no unsigned number reads as none at all
            self.assert_error(self.request({"request": "bulk"}, version), 7, "unsupported protocol version 0 (current 3)")
        for version in (2, 3):
            self.assertEqual(self.request({"request": "bulk", "flags": 5}, version), {})
        # The version is judged before the type, and before anything else.
        self.assertEqual(self.request({}, 1)["errorcode"], 7)

    def test_types(self):
        for message in ({}, {"request": 4}, {"request": ["find"]}):
            self.assert_error(self.request(message), 4, "invalid request format (missing type)")
        for kind in ("", "Find", "find ", "finds", "\u00e9", "x" * 100_000):
            self.assert_error(self.request({"request": kind}), 4, "unrecognized request")

    def test_find(self):
        known = uuid.UUID(self.form(self.data)["uuid"])
        by_uuid = qmx.decode_matches(self.request({"request": "find", "uuids": known})["matches"])
        self.assertEqual(by_uuid["identifier"], "com.example.data")
        both = {"request": "find", "uuids": known, "paths": "file://" + self.other}
        self.assertEqual(qmx.decode_matches(self.request(both)["matches"])["identifier"], "com.example.other")
        self.assertEqual(self.request({"request": "find", "uuids": known}, 2), {})

        nowhere = "file:///nowhere"
        for message in ({}, {"uuids": [known]}, {"uuids": str(known)}, {"uuids": uuid.uuid4()}, {"paths": nowhere},
                        {"paths": ["file://" + self.data]}, {"paths": self.data}, {"paths": "https://example.com" + self.data},
                        {"paths": "file://%"}, {"paths": "file://" + self.data + "%00"}, {"paths": ""},
                        {"uuids": known, "paths": nowhere}, {"paths": "file://" + "/x" * 100_000}):
            with self.subTest(str(message)[:100]):
                self.assert_error(self.request({"request": "find", **message}), 15, "Cannot locate PlugIn")

    def test_the_form(self):
        form = self.form(self.data)
        self.assertEqual(set(form) ^ FORM_KEYS, {"containingPath", "extensions", "localizedDisplayName",
                                                 "localizedShortName", "localizedContainingDisplayName"} & set(form))
        self.assertEqual(form["path"], self.data)
        self.assertEqual(form["containingPath"], self.app)
        self.assertEqual(form["uuid"], form["uuid"].upper())
        self.assertIs(form["systemResident"], False)
        self.assertEqual(form["version"], "1.0")
        self.assertEqual(form["hubProtocolVersion"], 2)
        self.assertEqual(form["annotations"], {})
        self.assertEqual(list(form["extensions"]), ["."])
        self.assertGreater(form["lastmodified"], 1_700_000_000)
        self.assertEqual(form["info"], form["bundleInfo"]["VKExtension"])

    def test_add(self):
        outside = self.platform.path("elsewhere/Out.app")
        bundles.write(outside + "/Info.vlist", {"VBBundleIdentifier": "com.example.out"})
        plugin = outside + "/PlugIns/Out.plugin"
        bundles.write(plugin + "/Info.vlist", bundles.manifest("com.example.outplugin"))
        self.assertEqual(self.request({"request": "add", "paths": []}), {})
        self.assertEqual(self.request({"request": "find", "paths": "file://" + plugin})["errorcode"], 15)
        missing = outside + "/missing"
        reply = self.request({"request": "add", "paths": [plugin, missing, self.data]})
        self.assert_error(reply, 9, "invalid plugin path: " + missing)
        self.assertEqual(self.form(plugin)["containingPath"], outside)  # what came before the failing path stays

        os.symlink(plugin, self.platform.path("elsewhere/link"))
        self.assertEqual(self.request({"request": "add", "paths": [self.platform.path("elsewhere/link")]}), {})
        empty = self.platform.path("elsewhere/empty")
        os.makedirs(empty)
        self.assert_error(self.request({"request": "add", "paths": [empty]}), 2, "unable to register plug-in at " + empty)
        for paths in (None, "text", 5, [5], [plugin, {}]):
            message = {"request": "add"} if paths is None else {"request": "add", "paths": paths}
            self.assert_error(self.request(message), 4, "invalid request format")
        self.assert_error(self.request({"request": "add", "paths": ["Out.plugin"]}), 9,
                          "absolute path required: Out.plugin")

    def test_remove_needs_the_manager_entitlement(self):
        reply = self.request({"request": "remove", "paths": [self.data, self.other]})
        self.assert_error(reply, 11, "caller lacks entitlement for this operation")
        self.form(self.data)
        self.assertEqual(self.request({"request": "remove", "paths": []}), {})
        refusals = self.platform.wait_for_log(r"refused request from pid=(\d+) to remove plug-in at (\S+) - client lacks "
                                              r"required entitlement")
        self.assertEqual(refusals, [(str(os.getpid()), self.data)])

    def test_remove_by_an_entitled_program(self):
        signed = self.platform.path("signed-zbctl")
        shutil.copy(os.path.join(scratch.BUILD, "bin/zbctl"), signed)
        done = self.platform.zbctl("sign", signed, "-e", "com.nordane.private.zembra.manager")
        self.assertEqual(done.returncode, 0, done.stderr)
        app = bundles.application(self.platform.root, "Going", {"Going.plugin": bundles.manifest("com.example.going")})
        going = bundles.plugin_path(app, "Going.plugin")
        self.platform.wait_for_log(r"INSTALLED:com\.example\.going")
        done = self.platform.zbctl("remove", going, program=signed)
        self.assertEqual((done.returncode, done.stderr), (0, ""))
        self.platform.wait_for_log(r"UNINSTALLED:com\.example\.going")
        self.assertEqual(self.request({"request": "find", "paths": "file://" + going})["errorcode"], 15)
        for path in (going, self.platform.path("nowhere")):
            done = self.platform.zbctl("remove", path, program=signed)
            self.assertEqual(done.returncode, 1)
            self.assertIn("no plugin at " + path, done.stderr)

    def test_requests_of_one_connection_are_answered_in_order(self):
        with qmx.Connection(self.platform.socket_path) as connection:
            known = uuid.UUID(self.form(self.data)["uuid"])
            ids = [connection.send({"request": "find", "version": 3, "uuids": known if i % 3 else uuid.uuid4()})
                   for i in range(3000)]
            for i, expected in enumerate(ids):
                answered, reply = connection.receive()
                self.assertEqual(answered, expected)
                self.assertEqual("matches" in reply, bool(i % 3))

    def test_a_value_that_is_no_dictionary_gets_no_reply_and_costs_nothing(self):
        with qmx.Connection(self.platform.socket_path) as connection:
            connection.send([1, 2, "three"])
            self.assertEqual(connection.request({"request": "bulk", "version": 3}), {})
        self.platform.wait_for_log(rf"unexpected message: .* from: {os.getpid()}")

    def test_counting(self):
        with qmx.Connection(self.platform.socket_path) as connection:
            for _ in range(1000):
                connection.request({"request": "bulk", "version": 3})
        self.platform.wait_for_log(rf"client {os.getpid()} used 1000 requests so far")


if __name__ == "__main__":
    unittest.main()
