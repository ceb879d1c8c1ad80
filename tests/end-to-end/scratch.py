"""A scratch platform for the end-to-end tests: real bundles below a temporary root and the real zbd process on it.

    with scratch.Platform() as platform:
        platform.start()
        platform.zbctl("find", platform.path("Applications/Editor.app/PlugIns/WordCount.appex"))
        log = platform.stop()

The build directory comes from the environment variable ZBD_BUILD.
"""

import ctypes
import errno
import os
import re
import select
import shutil
import signal
import socket
import stat
import subprocess
import sys
import tempfile
import time

SOURCE = os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
BUILD = os.path.abspath(os.environ.get("ZBD_BUILD", os.path.join(SOURCE, "build", "release")))
SERVICE = "com.nordane.zembra.zbd"
DEADLINE = 60  # seconds; only ever reached by a failure, so it may be generous

_IN_MODIFY, _IN_CREATE, _IN_MOVED_TO = 0x2, 0x100, 0x80
_libc = ctypes.CDLL(None, use_errno=True)


class _Watch:
    """inotify on one directory, so that waiting costs no polling interval."""

    def __init__(self, directory):
        self.descriptor = _libc.inotify_init1(os.O_CLOEXEC | os.O_NONBLOCK)
        mask = _IN_MODIFY | _IN_CREATE | _IN_MOVED_TO
        if self.descriptor < 0 or _libc.inotify_add_watch(self.descriptor, os.fsencode(directory), mask) < 0:
            raise OSError(ctypes.get_errno(), "inotify on " + directory)

    def wait(self, seconds):
        if select.select([self.descriptor], [], [], seconds)[0]:
            try:
                os.read(self.descriptor, 65536)
            except BlockingIOError:
                pass

    def close(self):
        os.close(self.descriptor)


class Platform:
    """One scratch root. Leaving the context kills what still runs and removes the directory."""

    def __init__(self, samples=True):
        self.directory = os.path.realpath(tempfile.mkdtemp(prefix="zbd-test-"))
        self.root = os.path.join(self.directory, "root")
        self.log_path = os.path.join(self.directory, "zbd.log")
        self.environment = {
            **{name: value for name, value in os.environ.items() if not name.startswith(("NORDANE_", "LISTEN_"))},
            "NORDANE_ROOT": self.root,
        }
        self.client_environment = dict(self.environment)
        self.environment["NORDANE_LOG"] = "debug,private,stderr"
        self.process = None
        for directory in ("Applications", "System/Library/PlugIns", "var/db", "run/nordane"):
            os.makedirs(self.path(directory))
        if samples:
            script = os.path.join(SOURCE, "samples", "layout.sh")
            subprocess.run([script, BUILD, self.root], check=True, stdout=subprocess.DEVNULL)

    def __enter__(self):
        return self

    def __exit__(self, *_):
        if self.process and self.process.poll() is None:
            self.process.kill()
            self.process.wait()
        # A test may have taken its own rights away below the root.
        for directory, names, _ in os.walk(self.directory):
            for name in names:
                path = os.path.join(directory, name)
                if not os.path.islink(path):
                    os.chmod(path, stat.S_IRWXU)
        shutil.rmtree(self.directory)

    def path(self, below):
        return os.path.join(self.root, below)

    @property
    def socket_path(self):
        return self.path("run/nordane/" + SERVICE)

    def start(self, *options, service=SERVICE, wrapper=()):
        """Starts zbd and returns when a connection to its socket is accepted by the system."""
        assert self.process is None or self.process.poll() is not None, "one daemon at a time"
        watch = _Watch(self.path("run/nordane"))
        try:
            with open(self.log_path, "ab") as log:
                self.process = subprocess.Popen([*wrapper, os.path.join(BUILD, "bin", "zbd"), *options],
                                                env=self.environment, stdin=subprocess.DEVNULL,
                                                stdout=log, stderr=log)
            deadline = time.monotonic() + DEADLINE
            while not self._listens(self.path("run/nordane/" + service)):
                if self.process.poll() is not None:
                    raise AssertionError(f"zbd ended with {self.process.returncode}:\n{self.log()}")
                if time.monotonic() > deadline:
                    raise AssertionError("zbd does not listen:\n" + self.log())
                watch.wait(0.05)  # the event of the name; listening follows it without an event of its own
        finally:
            watch.close()
        return self.process

    @staticmethod
    def _listens(path):
        # A path below a long temporary directory may not fit a socket address; the directory's descriptor does.
        directory = os.open(os.path.dirname(path), os.O_PATH | os.O_DIRECTORY | os.O_CLOEXEC)
        probe = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        try:
            probe.connect(f"/proc/self/fd/{directory}/{os.path.basename(path)}")
            return True
        except OSError as error:
            if error.errno in (errno.ENOENT, errno.ECONNREFUSED):
                return False
            raise
        finally:
            probe.close()
            os.close(directory)

    def stop(self):
        """SIGTERM, exit status 0, and the whole log."""
        self.process.send_signal(signal.SIGTERM)
        try:
            status = self.process.wait(DEADLINE)
        except subprocess.TimeoutExpired:
            raise AssertionError("zbd does not stop:\n" + self.log()) from None
        assert status == 0, f"zbd ended with {status}:\n{self.log()}"
        return self.log()

    def kill(self):
        self.process.kill()
        self.process.wait()

    def log(self):
        with open(self.log_path, encoding="utf-8", errors="replace") as log:
            return log.read()

    def wait_for_log(self, pattern, count=1):
        """Returns the matches once the log holds `count` of the regular expression; fails after a long time."""
        watch = _Watch(self.directory)
        try:
            deadline = time.monotonic() + DEADLINE
            while True:
                text = self.log()
                found = re.findall(pattern, text)
                if len(found) >= count:
                    return found
                if self.process.poll() is not None or time.monotonic() > deadline:
                    raise AssertionError(f"the log never showed {pattern!r} {count} times:\n{text}")
                watch.wait(1)
        finally:
            watch.close()

    def run(self, *command, text=True, **options):
        """Runs a client program on this platform; its output is captured."""
        if "input" not in options:
            options.setdefault("stdin", subprocess.DEVNULL)
        if text:
            options.setdefault("errors", "backslashreplace")
        return subprocess.run(command, env=self.client_environment, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=text,
                              timeout=DEADLINE, check=False, **options)

    def zbctl(self, *arguments, program=None, **options):
        return self.run(program or os.path.join(BUILD, "bin", "zbctl"), *arguments, **options)

    def start_zbctl(self, *arguments):
        """For a verb that runs on: the process, its outputs as text in pipes."""
        return subprocess.Popen([os.path.join(BUILD, "bin", "zbctl"), *arguments], env=self.client_environment,
                                stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)


if __name__ == "__main__":
    sys.exit("a module for the tests beside it")
