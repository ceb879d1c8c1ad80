"""A scratch platform for each test: bundles below a temporary root, the real zbd process, clients of it."""

import contextlib
import json
import os
import re
import shutil
import socket
import subprocess
import tempfile
import time
import unittest
import uuid

import qmx

BUILD = os.path.abspath(os.environ.get("ZBD_BUILD", __file__ + "/../../../build/release"))
ZBD, ZBCTL = BUILD + "/bin/zbd", BUILD + "/bin/zbctl"
SERVICE = "com.nordane.zembra.zbd"
MANAGER = "com.nordane.private.zembra.manager"
NOWHERE = uuid.UUID("00000000-0000-4000-8000-000000000000")  # of no plug-in
DEADLINE = 60  # seconds; only ever reached by a failure, so it may be generous


def vlist(value):
    return b"vlist16\n" + qmx.encode(value)


def write(path, content):
    """Replaces a file at once, by bytes or by the property list of a dictionary."""
    os.makedirs(os.path.dirname(path), exist_ok=True)
    with open(path + ".new", "wb") as file:
        file.write(content if isinstance(content, bytes) else vlist(content))
    os.rename(path + ".new", path)


def manifest(name, version="1.0", attributes=None, **extension):
    """A well-configured data-only plug-in's; keywords replace or add entries of its plug-in dictionary."""
    extension = {"VKExtensionPointIdentifier": "com.example.point", "VKExtensionProtocol": "#Data",
                 "VKExtensionAttributes": {"VKExtensionVersion": version, **(attributes or {})}, **extension}
    return {"VBBundleIdentifier": "com.example." + name, "VBBundleDisplayName": "com.example." + name,
            "VBBundleVersion": "1", "VKExtension": extension}


def error(code, text):
    return {"errorcode": code, "error": text}


def names(forms):
    return sorted(form["identifier"].removeprefix("com.example.") + " " + form["version"] for form in forms)


class Case(unittest.TestCase):
    """Each test has its own platform, which `prepare` furnishes; at its end zbd stops and all is removed."""

    def setUp(self):
        self.directory = self.enterContext(tempfile.TemporaryDirectory(prefix="zbd-", dir=os.path.realpath("/tmp")))
        self.environment = {name: value for name, value in os.environ.items()
                            if not name.startswith(("NORDANE_", "LISTEN_", "NOTIFY_"))}
        self.environment["NORDANE_ROOT"] = self.path("")
        self.daemon_environment = {**self.environment, "NORDANE_LOG": "debug,private,stderr"}
        for below in ("Applications", "var/db", "run/nordane"):
            os.makedirs(self.path(below))
        self.socket_path = self.path("run/nordane/" + SERVICE)
        self.prepare()

    def prepare(self):
        """Before each test."""

    def path(self, below):
        return os.path.join(self.directory, "root", below)

    def application(self, name, plugins):
        """Lays out an application, which appears as a whole; `plugins` maps bundles' names to manifests."""
        aside, path = self.path("var/" + name), self.path(f"Applications/{name}.app")
        write(aside + "/Info.vlist", {"VBBundleIdentifier": "com." + name, "VBBundleExecutable": "host"})
        for plugin, content in plugins.items():
            write(f"{aside}/PlugIns/{plugin}/Info.vlist", content)
        os.rename(aside, path)
        return path

    # The daemon.

    def start(self, *options, service=SERVICE, program=(ZBD,), **how):
        """Starts zbd and returns when the system accepts connections to its socket."""
        with open(self.directory + "/log", "wb") as log:
            self.process = subprocess.Popen([*program, *options], stdin=subprocess.DEVNULL, stderr=log,
                                            env=self.daemon_environment, **how)
        self.addCleanup(self.kill)
        self.addCleanup(lambda: self.process.poll() is None and self.stop())

        def listens():
            with socket.socket(socket.AF_UNIX) as probe:
                return probe.connect_ex(self.path("run/nordane/" + service)) == 0

        self.until(listens, "zbd listens")

    def until(self, ask, what):
        """Returns once `ask` answers true; fails when zbd has ended or after a long time."""
        end = time.monotonic() + DEADLINE
        while not ask():
            # Neither listening nor what is in the log is an event, so both are looked for.
            with contextlib.suppress(subprocess.TimeoutExpired):
                self.process.wait(0.02)
            if self.process.returncode is not None or time.monotonic() > end:
                self.fail(f"not seen: {what}; zbd's status is {self.process.returncode}:\n{self.log()}")

    def log(self):
        with open(self.directory + "/log", encoding="utf-8", errors="replace") as file:
            return file.read()

    def wait_for_log(self, pattern, count=1):
        """Returns once the log holds as many matches of the regular expression."""
        self.until(lambda: len(re.findall(pattern, self.log())) >= count, f"{pattern!r} {count} times logged")

    def stop(self):
        """SIGTERM, exit status 0, and the whole log."""
        self.process.terminate()
        self.assertEqual(self.process.wait(DEADLINE), 0, self.log())
        return self.log()

    def kill(self):
        self.process.kill()
        self.process.wait()

    # Clients.

    def request(self, kind, version=3, **message):
        with qmx.Connection(self.socket_path) as connection:
            return connection.request({"request": kind, "version": version, **message})

    def find(self, path):
        return qmx.decode(self.request("find", paths="file://" + path)["matches"])

    def uuid(self, path):
        return uuid.UUID(self.find(path)["uuid"])

    def match(self, flags=0, **message):
        return qmx.decode(self.request("match", flags=flags, **message)["matches"])

    def run_program(self, *command, **options):
        """Runs a client program on this platform; its outputs are captured as text."""
        options = {"env": self.environment, "input": "", "stdout": subprocess.PIPE, **options}
        return subprocess.run(command, stderr=subprocess.PIPE, text=True, errors="backslashreplace",
                              timeout=DEADLINE, check=False, **options)

    def zbctl(self, status, *arguments, program=ZBCTL, **options):
        result = self.run_program(program, *arguments, **options)
        self.assertEqual(result.returncode, status, (arguments, result.stdout, result.stderr))
        return result

    def zbctl_json(self, *arguments, **options):
        return json.loads(self.zbctl(0, "--json", *arguments, **options).stdout)

    def start_zbctl(self, *arguments):
        """For a verb that runs on: the process, its outputs as text in pipes."""
        process = self.enterContext(subprocess.Popen([ZBCTL, *arguments], env=self.environment, text=True,
                                                     stdout=subprocess.PIPE, stderr=subprocess.PIPE))
        self.addCleanup(process.kill)
        return process

    def copy_of_zbctl(self, path, *signing):
        """A host of its own there; `signing` gives it entitlements."""
        shutil.copy(ZBCTL, path)
        if self.run_program(ZBCTL, "sign", path, *signing).returncode != 0:
            self.skipTest("the file system keeps no extended attributes")
        return path
