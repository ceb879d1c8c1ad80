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
NO_MANAGER, NOT_REGISTERED = 121, 122
INTERPRETER = os.path.realpath("/usr/bin/python3")  # its library is where plug-ins may read
LANDLOCK_CREATE_RULESET = 444  # the same on every machine

ATTEMPTS = {  # and the plug-ins that may
    "open(bundle + '/Info.vlist')": ("Free", "Keys"),
    "open(os.environ['HOME'] + '/file', 'w')": ("Free", "Keys"),
    "socket.create_connection(('127.0.0.1', port))": ("Free",),
    "open(home)": (), "open(other + '/Info.vlist')": (), "open(bundle + '/Info.vlist', 'a')": (),
    "os.kill(os.getppid(), signal.SIGTERM)": (),
}
# Runs in the plug-in: tells the error that each attempt gave, or none.
TRY = """
import json, os, signal, socket, sys
def attempt(code):
    try:
        eval(code, globals(), json.loads(sys.argv[2]))
    except OSError as error:
        return type(error).__name__
print(json.dumps({code: attempt(code) for code in json.loads(sys.argv[1])}))
"""


@unittest.skipUnless(ctypes.CDLL(None).syscall(LANDLOCK_CREATE_RULESET, None, 0, 1) > 0,
                     "this kernel has no Landlock, so no plug-in is started")
class Launch(scratch.Case):
    def prepare(self):
        self.lab = self.path("Applications/Lab.app")
        for plugin, point in (("Free", "com.example.point"), ("Keys", "com.nordane.keyboard-service")):
            content = manifest(plugin.lower(), VKExtensionPointIdentifier=point)
            del content["VKExtension"]["VKExtensionProtocol"]  # not data alone
            content.update(VBBundleExecutable="Program", QMXService={})
            scratch.write(self.bundle(plugin) + "/Info.vlist", content)
            shutil.copy(INTERPRETER, self.bundle(plugin) + "/Program")  # each test brings its own code
        scratch.write(self.lab + "/Info.vlist", {"VBBundleIdentifier": "com.Lab", "VBBundleExecutable": "host"})
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
        with socket.create_server(("127.0.0.1", 0)) as listener:
            for plugin, other in (("Free", "Keys"), ("Keys", "Free")):
                facts = {"home": self.path("home"), "port": listener.getsockname()[1],
                         "bundle": self.bundle(plugin), "other": self.bundle(other)}
                result = self.launch(0, plugin, TRY, json.dumps(list(ATTEMPTS)), json.dumps(facts))
                expected = {attempt: None if plugin in allowed else "PermissionError"
                            for attempt, allowed in ATTEMPTS.items()}
                self.assertEqual(json.loads(result.stdout), expected, plugin)

    def test_who_may_launch(self):
        self.assertIn("is not registered for process", self.launch(NOT_REGISTERED, "Free").stderr)
        self.ready("Free")
        self.kill()
        self.launch(NO_MANAGER, "Free")
        self.start()
        self.launch(0, "Free")


if __name__ == "__main__":
    unittest.main()
