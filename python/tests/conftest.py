"""Fixtures of the Python package's tests: the development server and the real daemon,
each on temporary folders and a temporary socket, as the demo runs them.

The built programs come from the environment: TELVANED, TELVANE_DEVSERVER and
TELVANE_DEFAULTS (CTest sets them, with TELVANE_LIBRARY for the package). Waiting is
always for a condition, with a deadline.
"""

import json
import os
import shlex
import signal
import socket
import subprocess
import time

import pytest

STARTUP_TIMEOUT = 60.0
ARRIVAL_TIMEOUT = 40.0
# What a sanitized interpreter needs and the daemon and the server must not inherit.
_INTERPRETER_ONLY = ("LD_PRELOAD", "ASAN_OPTIONS")


def wait_until(condition, timeout, step=0.02):
    """True as soon as condition() holds; false when the deadline passes first."""
    deadline = time.monotonic() + timeout
    while True:
        if condition():
            return True
        if time.monotonic() >= deadline:
            return bool(condition())
        time.sleep(step)


def built_program(variable):
    path = os.environ.get(variable)
    if not path or not os.access(path, os.X_OK):
        pytest.fail(f"${variable} must name the built program (CTest sets it); it is {path!r}")
    return path


def child_environment(extra):
    environment = {k: v for k, v in os.environ.items() if k not in _INTERPRETER_ONLY}
    environment.update(extra)
    return environment


def running(process):
    return process.poll() is None


def stop(process, timeout=20.0):
    """SIGTERM, then the exit status (SIGKILL after the timeout)."""
    if running(process):
        process.send_signal(signal.SIGTERM)
    try:
        return process.wait(timeout)
    except subprocess.TimeoutExpired:
        process.kill()
        process.wait()
        return None


class DevServer:
    def __init__(self, directory):
        self.directory = directory
        self.events_file = directory / "arrivals.jsonl"
        self.ready_file = directory / "devserver.ready"
        self.output = directory / "devserver.out"
        self.values = {}
        with open(self.output, "wb") as out:
            self.process = subprocess.Popen(
                [built_program("TELVANE_DEVSERVER"), "--port", "0", "--udp-port", "0",
                 "--state", str(directory / "state"), "--events", str(self.events_file),
                 "--once-ready-file", str(self.ready_file), "--exit-with-parent"],
                stdout=out, stderr=subprocess.STDOUT, env=child_environment({}))
        ready = wait_until(lambda: self.ready_file.exists() or not running(self.process), STARTUP_TIMEOUT)
        if not ready or not running(self.process):
            pytest.fail("the development server did not start:\n" + self.output.read_text(errors="replace"))
        for line in self.ready_file.read_text().splitlines():
            name, _, value = line.partition("=")
            words = shlex.split(value)
            self.values[name] = words[0] if words else ""

    def arrivals(self):
        """Every arrival so far (one JSON object a line)."""
        if not self.events_file.exists():
            return []
        found = []
        for line in self.events_file.read_text().splitlines():
            try:
                found.append(json.loads(line))
            except ValueError:
                pass  # a line still being written
        return found

    def wait_for(self, predicate, count=1, timeout=ARRIVAL_TIMEOUT):
        """The arrivals for which the predicate holds, once there are `count` of them
        (fewer when the deadline passed)."""
        matching = []

        def enough():
            matching[:] = [a for a in self.arrivals() if predicate(a)]
            return len(matching) >= count

        wait_until(enough, timeout)
        return list(matching)


class Daemon:
    def __init__(self, directory, devserver):
        self.directory = directory
        self.socket_path = str(directory / "telvaned.sock")
        self.log_path = directory / "telvaned.log"
        entitlements = directory / "entitlements.d"
        entitlements.mkdir()
        (entitlements / "test.conf").write_text(f"com.zembra.private.telvaned uid:{os.getuid()}\n")
        (directory / "device-info.conf").write_text("UniqueDeviceID=0123456789abcdef0123456789abcdef76543210\n")
        self.environment = child_environment({
            "TELVANED_SOCKET": self.socket_path,
            "TELVANED_ENTITLEMENTS_DIR": str(entitlements),
            "TELVANE_DEFAULTS_DB": str(directory / "defaults.sqlite3"),
            "TELVANED_CACHE_DIR": str(directory / "cache"),
            "TELVANED_MESSAGE_LOG_DIR": str(directory / "messagelogs"),
            "TELVANED_STORAGE_DIR": str(directory / "storage"),
            "TELVANED_DEVICE_INFO": str(directory / "device-info.conf"),
            "TELVANED_CA_FILE": devserver.values["TELVANED_CA_FILE"],
            "TELVANED_PUBLIC_KEY": devserver.values["TELVANED_PUBLIC_KEY"],
            # A country the sample storebag's rule lists.
            "LC_ALL": "en_US.UTF-8",
            "TELVANE_LOG_LEVEL": "debug",
        })
        defaults = built_program("TELVANE_DEFAULTS")
        for arguments in (["telvane_storebag_url", "-string", devserver.values["TELVANE_DEVSERVER_STOREBAG_URL"]],
                          ["environmentType", "-int", "1"]):
            subprocess.run([defaults, "write", "com.zembra.telvane", *arguments], env=self.environment, check=True)
        with open(self.log_path, "wb") as log:
            self.process = subprocess.Popen([built_program("TELVANED")], stdout=log, stderr=subprocess.STDOUT,
                                            env=self.environment)
        if not wait_until(lambda: self._accepts() or not running(self.process), STARTUP_TIMEOUT) or \
                not running(self.process):
            pytest.fail("telvaned did not start:\n" + self.log())

    def _accepts(self):
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as probe:
            try:
                probe.connect(self.socket_path)
                return True
            except OSError:
                return False

    def log(self):
        return self.log_path.read_text(errors="replace") if self.log_path.exists() else ""


@pytest.fixture(scope="module")
def devserver(tmp_path_factory):
    server = DevServer(tmp_path_factory.mktemp("devserver"))
    yield server
    assert stop(server.process) == 0, server.output.read_text(errors="replace")


@pytest.fixture(scope="module")
def daemon(tmp_path_factory, devserver):
    process = Daemon(tmp_path_factory.mktemp("daemon"), devserver)
    # The package in this process reaches the daemon through its socket.
    previous = os.environ.get("TELVANED_SOCKET")
    os.environ["TELVANED_SOCKET"] = process.socket_path
    yield process
    if previous is None:
        os.environ.pop("TELVANED_SOCKET", None)
    else:
        os.environ["TELVANED_SOCKET"] = previous
    assert stop(process.process) == 0, process.log()[-8000:]
