#!/usr/bin/env python3
"""Every reply of the requests that the daemon serves, asked for by a client that shares no code with it."""

import os
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

    def assert_not_found(self, message, **more):
        self.assert_error(self.request({"request": "find", **message, **more}), 15, "Cannot locate PlugIn")

    def test_versions_and_types(self):
        self.assert_error(self.request({"request": "bulk"}, 4), 7, "unsupported protocol version 4 (current 3)")
        for version in (None, "3", -3, 3.0, True):  # what is no unsigned number reads as none at all
            self.assert_error(self.request({"request": "bulk"}, version), 7, "unsupported protocol version 0 (current 3)")
        for version in (2, 3):
            self.assertEqual(self.request({"request": "bulk", "flags": 5}, version), {})
        for message in ({}, {"request": 4}, {"request": ["find"]}):
            self.assert_error(self.request(message), 4, "invalid request format (missing type)")
        for kind in ("", "Find", "find ", "\u00e9", "x" * 100_000):
            self.assert_error(self.request({"request": kind}), 4, "unrecognized request")

    def test_find(self):
        known = uuid.UUID(self.form(self.data)["uuid"])
        for location, identifier in (({"uuids": known}, "com.example.data"),
                                     ({"uuids": known, "paths": "file://" + self.other}, "com.example.other")):
            matches = self.request({"request": "find", **location})["matches"]
            self.assertEqual(qmx.decode_matches(matches)["identifier"], identifier)
        self.assertEqual(self.request({"request": "find", "uuids": known}, 2), {})
        for wrong in ({}, {"uuids": [known]}, {"uuids": str(known)}, {"uuids": uuid.uuid4()},
                      {"uuids": known, "paths": "file:///nowhere"}):
            self.assert_not_found(wrong)
        for path in (["file://" + self.data], self.data, "https://example.com" + self.data, "", "file://%",
                     "file://" + self.data + "%00", "file://" + "/x" * 100_000):
            self.assert_not_found({"paths": path})

    def test_the_form(self):
        form = self.form(self.data)
        self.assertEqual(set(form) ^ FORM_KEYS, {"containingPath", "extensions", "localizedDisplayName",
                                                 "localizedShortName", "localizedContainingDisplayName"} & set(form))
        known = {"path": self.data, "containingPath": self.app, "uuid": form["uuid"].upper(), "systemResident": False,
                 "version": "1.0", "hubProtocolVersion": 2, "annotations": {}, "info": form["bundleInfo"]["VKExtension"]}
        self.assertEqual({key: form[key] for key in known}, known)
        self.assertEqual(list(form["extensions"]), ["."])
        self.assertGreater(form["lastmodified"], 1_700_000_000)

    def test_add(self):
        outside = self.platform.path("elsewhere/Out.app")
        bundles.write(outside + "/Info.vlist", {"VBBundleIdentifier": "com.example.out"})
        plugin, link, empty, missing = (outside + name for name in ("/PlugIns/Out.plugin", "/link", "/empty", "/missing"))
        bundles.write(plugin + "/Info.vlist", bundles.manifest("com.example.outplugin"))
        os.symlink(plugin, link)
        os.makedirs(empty)
        self.assertEqual(self.request({"request": "add", "paths": []}), {})
        self.assert_not_found({"paths": "file://" + plugin})
        self.assert_error(self.request({"request": "add", "paths": [plugin, missing, self.data]}), 9,
                          "invalid plugin path: " + missing)
        self.assertEqual(self.form(plugin)["containingPath"], outside)  # what came before the failing path stays
        self.assertEqual(self.request({"request": "add", "paths": [link]}), {})
        self.assert_error(self.request({"request": "add", "paths": [empty]}), 2, "unable to register plug-in at " + empty)
        for paths in ("text", [5], [plugin, {}]):
            self.assert_error(self.request({"request": "add", "paths": paths}), 4, "invalid request format")
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

    def test_requests_of_one_connection_are_answered_in_order(self):
        with qmx.Connection(self.platform.socket_path) as connection:
            known = uuid.UUID(self.form(self.data)["uuid"])
            ids = [connection.send({"request": "find", "version": 3, "uuids": known if i % 3 else uuid.uuid4()})
                   for i in range(3000)]
            replies = [connection.receive() for _ in ids]
        self.assertEqual([answered for answered, _ in replies], ids)
        self.assertEqual(["matches" in reply for _, reply in replies], [bool(i % 3) for i in range(3000)])

    def test_a_value_that_is_no_dictionary_gets_no_reply_and_costs_nothing(self):
        with qmx.Connection(self.platform.socket_path) as connection:
            connection.send([1, 2, "three"])
            self.assertEqual(connection.request({"request": "bulk", "version": 3}), {})
        self.platform.wait_for_log(rf"unexpected message: .* from: {os.getpid()}")


if __name__ == "__main__":
    unittest.main()
