"""Plug-ins that this process, their host, really starts: what they get, cannot reach, and who starts them."""

import ctypes
import json
import os
import shutil
import socket
import unittest

import scratch
from scratch import manifest

ZBIGNITE = scratch.BUILD + "/bin/zbignite"
USAGE, NO_MANAGER, NOT_REGISTERED, REFUSED, NOT_EXECUTED = 120, 121, 122, 123, 125
INTERPRETER = os.path.realpath("/usr/bin/python3")  # its library is where plug-ins may read
LANDLOCK_CREATE_RULESET = 444  # the same on every machine

ATTEMPTS = {  # and the plug-ins that may
    "open(bundle + '/Info.vlist')": ("Free", "Keys"),
    "open(os.environ['HOME'] + '/file', 'w')": ("Free", "Keys"),
    "open(container + '/file')": ("Keys",),
    "socket.create_connection(('127.0.0.1', port))": ("Free",),
    "open(home)": (),
    "open(other + '/Info.vlist')": (),
    "open(bundle + '/Info.vlist', 'a')": (),
    "os.kill(os.getppid(), signal.SIGTERM)": (),
}
# Runs in the plug-in: the error that each attempt gave, or none.
TRY = """
import json, os, signal, socket, sys
results = {}
for attempt in json.loads(sys.argv[1]):
    try:
        eval(attempt, globals(), json.loads(sys.argv[2]))
        results[attempt] = None
    except OSError as error:
        results[attempt] = type(error).__name__
print(json.dumps(results))
"""


def code_manifest(name, service=None, **extension):
    content = manifest(name, **extension)
    del content["VKExtension"]["VKExtensionProtocol"]  # not data alone
    return {**content, "VBBundleExecutable": "Program", "QMXService": service or {}}


@unittest.skipUnless(ctypes.CDLL(None).syscall(LANDLOCK_CREATE_RULESET, None, 0, 1) > 0,
                     "this kernel has no Landlock, so no plug-in is started")
class Launch(scratch.Case):
    def prepare(self):
        self.lab = self.application("Lab", {
            "Free.appex": code_manifest("free"),
            "Keys.appex": code_manifest("keys", VKExtensionPointIdentifier="com.nordane.keyboard-service",
                                        VKExtensionIdentifier="com.example.own-keys"),
            "Wrong.appex": code_manifest("wrong", {"EnvironmentVariables": {"OWN": 1}}),
            "Script.appex": code_manifest("script"),
        })
        for plugin in ("Free", "Keys", "Wrong"):
            shutil.copy(INTERPRETER, self.bundle(plugin) + "/Program")  # each test brings its own code
        scratch.write(self.bundle("Script") + "/Program", b"#!/bin/sh\n")
        os.chmod(self.bundle("Script") + "/Program", 0o755)
        self.start()
        # A confined process cannot be looked into, so neither can it look for leaks at its end.
        self.environment["ASAN_OPTIONS"] = "detect_leaks=0"

    def bundle(self, plugin):
        return f"{self.lab}/PlugIns/{plugin}.appex"

    def ready(self, *plugins):
        uuids = [self.uuid(self.bundle(plugin)) for plugin in plugins]
        self.assertEqual(self.request("ready", uuids=uuids), {})

    def launch(self, status, plugin, code="", *arguments):
        result = self.run_program(ZBIGNITE, "com.example." + plugin.lower(), "-c", code, *arguments)
        self.assertEqual(result.returncode, status, result.stderr)
        return result

    def test_confinement(self):
        scratch.write(self.path("home"), b"secret")
        self.ready("Free", "Keys")
        where = "import os; open('file', 'w'); print(os.getcwd(), os.environ['HOME'])"
        container, home = self.launch(0, "Keys", where).stdout.split()
        self.assertEqual(container, home)
        self.assertEqual(os.path.basename(container), "com.example.own-keys")
        with socket.create_server(("127.0.0.1", 0)) as listener:
            for plugin, other in (("Free", "Keys"), ("Keys", "Free")):
                facts = {"home": self.path("home"), "container": container, "port": listener.getsockname()[1],
                         "bundle": self.bundle(plugin), "other": self.bundle(other)}
                result = self.launch(0, plugin, TRY, json.dumps(list(ATTEMPTS)), json.dumps(facts))
                expected = {attempt: None if plugin in allowed else "PermissionError"
                            for attempt, allowed in ATTEMPTS.items()}
                self.assertEqual(json.loads(result.stdout), expected, plugin)

    def test_who_may_launch(self):
        self.assertIn("is not registered for process", self.launch(NOT_REGISTERED, "Free").stderr)
        self.ready("Free", "Wrong", "Script")
        self.assertIn('the environment variable "OWN" is no string', self.launch(REFUSED, "Wrong").stderr)
        self.assertIn("a script", self.launch(NOT_EXECUTED, "Script").stderr)
        self.assertEqual(self.run_program(ZBIGNITE).returncode, USAGE)
        self.kill()
        self.launch(NO_MANAGER, "Free")
        self.start()
        self.launch(0, "Free")


if __name__ == "__main__":
    unittest.main()
