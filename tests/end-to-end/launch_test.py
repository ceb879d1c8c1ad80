#!/usr/bin/env python3
"""Plug-ins that are really started: what they get, what they cannot reach, and what ends them.

This process is the host. The plug-ins' program is a copy of the Python interpreter, so each test brings its own code.
"""

import contextlib
import json
import os
import shutil
import signal
import socket
import subprocess
import unittest
import uuid

import bundles
import qmx
import scratch

USAGE, NO_MANAGER, NOT_REGISTERED, REFUSED, NOT_EXECUTED = 120, 121, 122, 123, 125
PLUG_INS, TERMINATE = 1, 4
INTERPRETER = os.path.realpath("/usr/bin/python3")  # its library is where plug-ins may read
LANDLOCK_CREATE_RULESET = 444  # the same on every machine

# Runs in the plug-in: each attempt's name and the error it gave, or none.
ATTEMPTS = """
import json, os, signal, socket, sys
facts = json.loads(sys.argv[1])

def connect():
    with socket.socket(socket.AF_INET) as client:
        client.connect(("127.0.0.1", facts["port"]))

def serve():
    with socket.socket(socket.AF_INET) as server:
        server.listen()

attempts = {
    "own resource": lambda: open(facts["bundle"] + "/Info.vlist").close(),
    "own file": lambda: open(os.environ["HOME"] + "/file", "w").close(),
    "temporary file": lambda: open(os.environ["TMPDIR"] + "/file", "w").close(),
    "home": lambda: open(facts["home"]).close(),
    "other container": lambda: open(facts["container"]).close(),
    "other bundle": lambda: open(facts["other"] + "/Info.vlist").close(),
    "own bundle": lambda: open(facts["bundle"] + "/Info.vlist", "a").close(),
    "host's memory": lambda: open("/proc/%d/mem" % os.getppid()).close(),
    "host": lambda: os.kill(os.getppid(), signal.SIGTERM),
    "set-user-id program": lambda: os.execv("/usr/bin/su", ["su"]),
    "daemon": lambda: socket.socket(socket.AF_UNIX, socket.SOCK_STREAM),
    "connect": connect,
    "serve": serve,
}
results = {}
for name, attempt in attempts.items():
    try:
        attempt()
        results[name] = None
    except OSError as error:
        results[name] = type(error).__name__
print(json.dumps(results))
"""
ALLOWED = {"own resource", "own file", "temporary file"}

# Runs in the plug-in: what the broker gives for a token (and a path below).
CONSUME = """
import array, os, socket, sys
connection = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
os.chdir(sys.argv[1])
connection.connect("com.nordane.sandbox")
connection.send("\\0".join(sys.argv[2:]).encode())
answer, control, _, _ = connection.recvmsg(4, socket.CMSG_SPACE(4))
number = int.from_bytes(answer, sys.byteorder)
print(number or os.read(array.array("i", control[0][2])[0], 5).decode())
"""


def has_landlock():
    libc = scratch._libc  # pylint: disable=protected-access
    return libc.syscall(LANDLOCK_CREATE_RULESET, None, 0, 1) > 0


def manifest(name, **entries):
    content = bundles.manifest("com.example." + name, **entries.pop("extension", {}))
    del content["VKExtension"]["VKExtensionProtocol"]  # not data alone
    return {**content, "VBBundleExecutable": "Program", **entries}


@unittest.skipUnless(has_landlock(), "this kernel has no Landlock, so no plug-in is started")
class Launch(unittest.TestCase):
    def setUp(self):
        self.platform = scratch.Platform(samples=False)
        self.addCleanup(self.platform.__exit__, None, None, None)
        self.application = bundles.application(self.platform.root, "Lab", {
            "Free.appex": manifest("free"),
            "Keys.appex": manifest("keys", extension={"VKExtensionPointIdentifier": "com.nordane.keyboard-service",
                                                      "VKExtensionIdentifier": "com.example.own-keys"}),
            "Wrong.appex": manifest("wrong", QMXService={"EnvironmentVariables": {"OWN": 1}}),
            "Script.appex": manifest("script"),
        })
        for plugin in ("Free", "Keys", "Wrong"):
            shutil.copy(INTERPRETER, self.program(plugin))
        with open(self.program("Script"), "w", encoding="utf-8") as script:
            script.write("#!/bin/sh\n")
        os.chmod(self.program("Script"), 0o755)
        self.platform.start()
        # A confined process cannot be looked into, so neither can it look for leaks at its end.
        self.platform.client_environment["ASAN_OPTIONS"] = "detect_leaks=0"

    def bundle(self, plugin):
        return bundles.plugin_path(self.application, plugin + ".appex")

    def program(self, plugin):
        return os.path.join(self.bundle(plugin), "Program")

    def request(self, **message):
        with qmx.Connection(self.platform.socket_path) as connection:
            return connection.request({"version": 3, **message})

    def uuid(self, plugin):
        form = json.loads(self.platform.zbctl("--json", "find", self.bundle(plugin)).stdout)
        return uuid.UUID(form["uuid"])

    def ready(self, *plugins):
        reply = self.request(request="ready", uuids=[self.uuid(plugin) for plugin in plugins])
        self.assertNotIn("error", reply)

    def launcher(self, plugin, *arguments):
        return [os.path.join(scratch.BUILD, "bin", "zbignite"), "com.example." + plugin.lower(), *arguments]

    def launch(self, plugin, code="", *arguments):
        return self.platform.run(*self.launcher(plugin, "-c", code, *arguments))

    def expect(self, status, plugin, text=""):
        result = self.launch(plugin)
        self.assertEqual(result.returncode, status, result.stderr)
        self.assertIn(text, result.stderr)

    @contextlib.contextmanager
    def running(self, plugin):
        """A plug-in that runs until it is ended."""
        process = subprocess.Popen(self.launcher(plugin, "-c", "print(flush=True); input()"), stdin=subprocess.PIPE,
                                   stdout=subprocess.PIPE, stderr=subprocess.PIPE, env=self.platform.client_environment)
        try:
            process.stdout.readline()
            yield process
        finally:
            process.kill()
            process.communicate()

    def test_confinement(self):
        home = os.path.join(self.platform.directory, "home")
        with open(home, "w", encoding="utf-8") as file:
            file.write("secret")
        self.ready("Free", "Keys")
        container, given = self.launch(
            "Keys", "import os; open('file', 'w'); print(os.getcwd(), os.environ['HOME'])").stdout.split()
        self.assertEqual(given, container)
        self.assertEqual(os.path.basename(container), "com.example.own-keys")
        with socket.create_server(("127.0.0.1", 0)) as listener:
            for plugin, other, network in (("Free", "Keys", {"connect"}), ("Keys", "Free", set())):
                facts = {"home": home, "container": container + "/file", "bundle": self.bundle(plugin),
                         "other": self.bundle(other), "port": listener.getsockname()[1]}
                result = self.launch(plugin, ATTEMPTS, json.dumps(facts))
                self.assertEqual(result.returncode, 0, result.stderr)
                results = json.loads(result.stdout)
                allowed = ALLOWED | network | ({"other container"} if plugin == "Keys" else set())
                self.assertEqual({name for name, error in results.items() if error is None}, allowed, results)
                self.assertEqual({error for error in results.values() if error}, {"PermissionError"}, results)

    def test_tokens_open_what_a_plug_in_cannot(self):
        self.ready("Free")
        token, = self.request(request="access", uuids=[self.uuid("Keys")])["extensions"]
        runtime = os.path.dirname(self.platform.socket_path)
        for words, answer in (((token, "Info.vlist"), "<?xml"), ((token, "../Free.appex/Info.vlist"), "18"),
                              ((token[:-1] + "x", "Info.vlist"), "1"), (("no token",), "1")):
            self.assertEqual(self.launch("Free", CONSUME, runtime, *words).stdout.strip(), answer, words)

    def test_who_may_launch(self):
        self.expect(NOT_REGISTERED, "Free", "is not registered for process")
        self.ready("Free", "Wrong", "Script")
        self.expect(0, "Free")
        self.expect(REFUSED, "Wrong", 'the environment variable "OWN" is no string')
        self.expect(NOT_EXECUTED, "Script", "a script")
        self.expect(NOT_REGISTERED, "Keys")
        # Its host is the shell, which was granted nothing.
        by_shell = self.platform.run("/bin/sh", "-c", '"$@"; exit $?', "sh", *self.launcher("Free"))
        self.assertEqual(by_shell.returncode, NOT_REGISTERED)
        self.assertEqual(self.platform.run(*self.launcher("Free")[:1]).returncode, USAGE)
        self.platform.kill()
        self.expect(NO_MANAGER, "Free")
        self.platform.start()
        self.expect(0, "Free")

    def test_forced_hold_and_uninstall_end_instances(self):
        self.ready("Free", "Keys")
        with self.running("Free") as free, self.running("Keys") as keys:
            with qmx.Connection(self.platform.socket_path) as connection:
                reply = connection.request({"request": "lock", "version": 3, "paths": [self.bundle("Free")],
                                            "flags": PLUG_INS | TERMINATE})
                self.assertNotIn("error", reply)
                self.assertEqual(free.wait(scratch.DEADLINE), -signal.SIGTERM)
                self.expect(NOT_REGISTERED, "Free")
            self.assertIsNone(keys.poll())
            os.rename(self.application, self.platform.path("var/Lab.app"))
            self.assertEqual(keys.wait(scratch.DEADLINE), -signal.SIGTERM)
        self.expect(NOT_REGISTERED, "Keys")


if __name__ == "__main__":
    unittest.main()
