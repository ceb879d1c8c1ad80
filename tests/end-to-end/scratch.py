"""A scratch platform for the end-to-end tests: real bundles below a temporary root and the real zbd process on it.

    with scratch.Platform() as platform:
        platform.start()
        platform.zbctl("find", platform.path("Applications/Editor.app/PlugIns/WordCount.appex"))
        log = platform.stop()

The build directory comes from the environment variable ZBD_BUILD.
"""

import contextlib
import ctypes
import os
import re
import select
import shutil
import signal
import stat
import subprocess
import tempfile
import time

import qmx

SOURCE = os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
BUILD = os.path.abspath(os.environ.get("ZBD_BUILD", os.path.join(SOURCE, "build", "release")))
SERVICE = "com.nordane.zembra.zbd"
DEADLINE = 60  # seconds; only ever reached by a failure, so it may be generous

_IN_MODIFY, _IN_CREATE, _IN_MOVED_TO = 0x2, 0x100, 0x80
_libc = ctypes.CDLL(None, use_errno=True)


@contextlib.contextmanager
def _changes(directory):
    """Gives what waits for a change in `directory`, for some seconds at the most."""
    descriptor = _libc.inotify_init1(os.O_CLOEXEC | os.O_NONBLOCK)
    mask = _IN_MODIFY | _IN_CREATE | _IN_MOVED_TO
    if descriptor < 0 or _libc.inotify_add_watch(descriptor, os.fsencode(directory), mask) < 0:
        raise OSError(ctypes.get_errno(), "inotify on " + directory)

    def wait(seconds):
        if select.select([descriptor], [], [], seconds)[0]:
            os.read(descriptor, 65536)

    try:
        yield wait
    finally:
        os.close(descriptor)


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
        with _changes(self.path("run/nordane")) as wait:
            with open(self.log_path, "ab") as log:
                self.process = subprocess.Popen([*wrapper, os.path.join(BUILD, "bin", "zbd"), *options],
                                                env=self.environment, stdin=subprocess.DEVNULL,
                                                stdout=log, stderr=log)
            # The event of the name; listening follows it without an event of its own.
            self._until(lambda: self._listens(self.path("run/nordane/" + service)), lambda: wait(0.05), "zbd listens")
        return self.process

    def _until(self, ask, wait, what):
        """What `ask` answers once that is true; fails when zbd has ended or after a long time."""
        deadline = time.monotonic() + DEADLINE
        while not (answer := ask()):
            if self.process.poll() is not None or time.monotonic() > deadline:
                raise AssertionError(f"not seen: {what}; zbd's status is {self.process.returncode}:\n{self.log()}")
            wait()
        return answer

    @staticmethod
    def _listens(path):
        try:
            qmx.connect_socket(path).close()
            return True
        except (FileNotFoundError, ConnectionRefusedError):
            return False

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
        def found():
            matches = re.findall(pattern, self.log())
            return matches if len(matches) >= count else None

        with _changes(self.directory) as wait:
            return self._until(found, lambda: wait(1), f"{pattern!r} {count} times in the log")

    def run(self, *command, **options):
        """Runs a client program on this platform; its output is captured as text."""
        options = {"env": self.client_environment, "stdout": subprocess.PIPE, **options}
        if "input" not in options:
            options["stdin"] = subprocess.DEVNULL
        return subprocess.run(command, stderr=subprocess.PIPE, text=True, errors="backslashreplace", timeout=DEADLINE,
                              check=False, **options)

    def zbctl(self, *arguments, program=None, **options):
        return self.run(program or os.path.join(BUILD, "bin", "zbctl"), *arguments, **options)

    def start_zbctl(self, *arguments):
        """For a verb that runs on: the process, its outputs as text in pipes."""
        return subprocess.Popen([os.path.join(BUILD, "bin", "zbctl"), *arguments], env=self.client_environment,
                                stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
