"""Every reply of every request type, asked for by a client that shares no code with the daemon."""

import concurrent.futures
import os
import unittest

import qmx
import scratch
from scratch import NOWHERE, error, manifest

ALL, PLUG_INS = 0x200, 1  # flags of "match" and of "lock"
FORM_KEYS = {"hubProtocolVersion", "path", "systemResident", "identifier", "original-identifier", "version",
             "bundleInfo", "info", "uuid", "lastmodified", "annotations", "localizedFilevaneActionNames"}


class Protocol(scratch.Case):
    def prepare(self):
        self.app = self.application("Paper", {"Data.plugin": manifest("data", Shared=["."]),
                                              "Other.plugin": manifest("other")})
        self.data, self.other = self.app + "/PlugIns/Data.plugin", self.app + "/PlugIns/Other.plugin"
        self.start()

    def test_error_replies(self):
        known, text = self.uuid(self.data), str(self.uuid(self.data))
        empty, loop, endless = self.path("empty"), self.path("loop"), self.path("a/" * 3000)
        os.makedirs(empty)
        os.symlink("loop", loop)
        malformed, unknown = "invalid request format", "no such plugin (uuid not found)"
        rules, dictionary = malformed + " (bad rules dictionary)", malformed + " (bad annotations dictionary)"
        one, election = {"uuids": [known]}, {"election": 1}
        for kind, code, expected, *messages in (
            ("bulk", 7, "unsupported protocol version 4 (current 3)", {"version": 4}),
            # What is no unsigned number reads as none at all.
            ("bulk", 7, "unsupported protocol version 0 (current 3)", {"version": "3"}, {"version": -3},
             {"version": 3.0}, {"version": True}),
            (4, 4, malformed + " (missing type)", {}),
            ("Find", 4, "unrecognized request", {}),
            ("find", 15, "Cannot locate PlugIn", {}, {"uuids": [known]}, {"uuids": text}, {"uuids": NOWHERE},
             {"uuids": known, "paths": "file:///nowhere"}, {"paths": ["file://" + self.data]},
             *({"paths": path} for path in (self.data, "https://example.com" + self.data, "", "file://%",
                                            f"file://{self.data}%00", "file:///%FF", "file://" + "/x" * 100_000))),
            ("add", 4, malformed, {}, {"paths": "text"}, {"paths": [5]}, {"paths": [self.data, {}]}),
            ("add", 9, "absolute path required: x", {"paths": ["x"]}),
            ("add", 9, "invalid plugin path: " + loop, {"paths": [loop]}),
            ("add", 9, "invalid plugin path: " + endless, {"paths": [endless]}),
            ("add", 2, "unable to register plug-in at " + empty, {"paths": [empty]}),
            ("remove", 11, "caller lacks entitlement for this operation", {"paths": [self.data, self.other]}),
            ("match", 4, rules, {"rules": "x"}, {"rules": []}, {"rules": 1}),
            ("match", 11, "unauthorized discovery flag (ZBDiscoverAll)", {"flags": ALL}),
            ("ready", 4, unknown, {"uuids": [NOWHERE]}),
            ("access", 4, unknown, {"uuids": [NOWHERE]}),
            ("annotate", 4, dictionary, one, {**one, "annotations": []}),
            ("annotate", 4, malformed + " (annotation election)", {**one, "annotations": {"election": "1"}}),
            ("annotate", 4, malformed + " (annotation extension)",
             {**one, "annotations": {**election, "extension": 1}}),
            ("annotate", 4, malformed + " (uuid)", {"uuids": known, "annotations": election}),
            ("annotate", 4, "invalid request (bad uuid array)", {"uuids": [text], "annotations": election}),
            ("annotate", 4, unknown, {"uuids": [NOWHERE], "paths": [self.data] * 2, "annotations": election},
             {"uuids": [NOWHERE], "paths": ["/nowhere"], "annotations": election}),
            ("bulk-annotate", 4, dictionary, {}, {"annotations": []}),
            ("bulk-annotate", 18, "annotations values must be dictionaries", {"annotations": {text: 1}}),
            ("bulk-annotate", 18, "invalid plug-in UUID value", {"annotations": {"x": {}}}),
            ("bulk-annotate", 2, "no plug-in with the requested uuid", {"annotations": {str(NOWHERE): {}}}),
            ("lock", 4, malformed, {}, {"paths": self.app}, {"paths": [1]}, {"uuids": NOWHERE}),
            ("lock", 9, "absolute path required: x", {"paths": ["x"]}),
            ("lock", 9, "invalid path: /nowhere", {"paths": [self.app, "/nowhere"]}),
            ("lock", 9, "no plug-in at path:" + self.app, {"paths": [self.app], "flags": PLUG_INS}),
        ):
            for message in messages:
                with self.subTest(f"{kind} {message}"[:200]):
                    self.assertEqual(self.request(kind, **message), error(code, expected))
        # Nothing was removed or elected, and nothing is held.
        self.assertEqual(len(self.match(rules={"VKUserElection": "0"})), 2)
        refusal = f"pid={os.getpid()} to remove plug-in at {self.data} - client lacks required entitlement"
        self.wait_for_log("refused request from " + refusal)

    def test_replies_of_success(self):
        known, form = self.uuid(self.data), self.find(self.data)
        for kind, message in (
            ("bulk", {"version": 2}), ("bulk", {"flags": 5}), ("add", {"paths": []}),
            ("add", {"paths": [self.data]}), ("remove", {"paths": []}), ("match", {"version": 2}),
            ("find", {"version": 2, "uuids": known}), ("annotate", {"annotations": {"other": 1}}),
            ("bulk-annotate", {"annotations": {}}), ("lock", {"uuids": [NOWHERE, "x", 1]}),
            ("ready", {"uuids": [known]}),
        ):
            self.assertEqual(self.request(kind, **message), {}, (kind, message))
        tokens = self.request("access", uuids=[known, NOWHERE], paths=["", self.other])["extensions"]
        self.assertEqual(len(set(tokens)), 2)
        for message in ({}, {"flags": "8"}, {"flags": -1}, {"rules": {}}):
            self.assertEqual(len(self.match(**message)), 2, message)
        self.assertEqual(qmx.decode(self.request("find", uuids=known)["matches"]), form)
        self.assertLessEqual(FORM_KEYS, set(form))
        expected = {"path": self.data, "containingPath": self.app, "uuid": str(known).upper(),
                    "info": form["bundleInfo"]["VKExtension"], "version": "1.0", "systemResident": False, "hubProtocolVersion": 2}
        self.assertEqual({key: form[key] for key in expected}, expected)
        self.assertEqual(list(form["extensions"]), ["."])
        self.assertGreater(form["lastmodified"], 1_700_000_000)

    def test_each_client_gets_its_own_replies_in_order(self):
        known = self.uuid(self.data)

        def ask(_):
            with qmx.Connection(self.socket_path) as connection:
                connection.send([1, 2, "no dictionary"])  # gets no reply
                for _ in range(20):
                    asked = [known, NOWHERE, known] * 20
                    ids = [connection.send({"request": "find", "version": 3, "uuids": i}) for i in asked]
                    replies = [connection.receive() for _ in ids]
                    self.assertEqual([answered for answered, _ in replies], ids)
                    self.assertEqual(["error" in reply for _, reply in replies], [i == NOWHERE for i in asked])

        with concurrent.futures.ThreadPoolExecutor(8) as pool:
            list(pool.map(ask, range(8)))  # raises what a thread raised
        self.wait_for_log(rf"unexpected message: .* from: {os.getpid()}", 8)


if __name__ == "__main__":
    unittest.main()
