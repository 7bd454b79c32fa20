"""A scratch home for each test, the built program in it, and the wire format spoken from outside."""

import os
import pathlib
import plistlib
import shutil
import signal
import socket
import struct
import subprocess
import tempfile
import time

import pytest

EXAMPLES = pathlib.Path(__file__).parents[2] / "examples" / "bundles"
REQUEST, REPLY, DROPPED = 1, 2, 3
UPDATE = {"command": "get_and_update_services_plist"}
GET = {"command": "get_services_plist"}
FLUSH = {"command": "flush"}


def wait_until(condition, what, seconds=30):
    """The first true value of `condition()`."""
    deadline = time.monotonic() + seconds
    while not (value := condition()):
        assert time.monotonic() < deadline, f"waited in vain for: {what}"
        time.sleep(0.01)
    return value


def encode(message):
    return plistlib.dumps(message, fmt=plistlib.FMT_BINARY)


def frame(payload, tag=7):
    return struct.pack(">IIQ", len(payload), REQUEST, tag) + payload


class Peer:
    """One end of a connection; every wait has a deadline."""

    def __init__(self, connected):
        self.socket = connected
        self.socket.settimeout(30)

    def read(self, count):
        """`count` bytes, or fewer when the other end has closed."""
        read = b""
        try:
            while len(read) < count and (more := self.socket.recv(count - len(read))):
                read += more
        except ConnectionResetError:
            pass
        return read

    def receive(self):
        """(kind, tag, contents) of the next frame; None when the other end has closed."""
        if len(header := self.read(16)) < 16:
            return None
        length, kind, tag = struct.unpack(">IIQ", header)
        payload = self.read(length)
        return kind, tag, plistlib.loads(payload) if payload else None

    def ask(self, message):
        """The contents of the reply, or DROPPED."""
        self.socket.sendall(frame(encode(message)))
        kind, tag, contents = self.receive()
        assert tag == 7 and kind in (REPLY, DROPPED)
        return contents if kind == REPLY else DROPPED


class Home:
    def __init__(self, root):
        self.root = pathlib.Path(root)
        self.home, self.run = self.root / "home", self.root / "run"
        self.cache = self.home / ".cache" / "com.orvex.qvservicescache.plist"
        self.state = self.home / ".local" / "state" / "kel"
        self.endpoint = self.run / "kel" / "com.orvex.kel.fetch_services"
        self.log_path = self.root / "log"
        for made in (self.home, self.run, self.root / "tmp"):
            made.mkdir(mode=0o700)
        self.environment = {
            name: value for name, value in os.environ.items()
            if not name.startswith(("XDG_", "LISTEN_")) and name not in ("NOTIFY_SOCKET", "QVRunningFromWarden")
        } | {
            "HOME": str(self.home), "TMPDIR": str(self.root / "tmp"), "XDG_RUNTIME_DIR": str(self.run),
            "XDG_CACHE_HOME": str(self.home / ".cache"), "XDG_STATE_HOME": str(self.home / ".local" / "state"),
            "XDG_CONFIG_HOME": str(self.home / ".config"),
        }  # fmt: skip
        self.server = None

    def put_bundle(self, name, title, directory="Library/Services"):
        path = self.home / directory / name
        path.mkdir(parents=True, exist_ok=True)
        declared = {"QVMessage": "go", "QVMenuItem": {"default": title}}
        (path / "Info.plist").write_bytes(encode({"KTBundleIdentifier": f"org.example.{name}", "QVServices": [declared]}))

    def spawn(self, *launcher, **options):
        variables = self.environment | {"QVRunningFromWarden": "1"}
        return subprocess.Popen([*launcher, os.environ["KEL_PROGRAM"]], env=variables, **options)

    def start(self, **options):
        with open(self.log_path, "ab") as log:
            self.server = self.spawn(stderr=log, **options)
        wait_until(self.connects, "the server")

    def connects(self):
        assert self.server.poll() is None, self.log()
        try:
            self.connect().socket.close()
        except (FileNotFoundError, ConnectionRefusedError):
            return False
        return True

    def connect(self):
        connecting = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        connecting.connect(str(self.endpoint))
        return Peer(connecting)

    def ask(self, message):
        peer = self.connect()
        try:
            return peer.ask(message)
        finally:
            peer.socket.close()

    def services(self, message=GET):
        return plistlib.loads(self.ask(message)["data"])

    def titles(self, message=GET):
        return [service["QVMenuItem"].get("default") for service in self.services(message)]

    def client(self, *arguments, **variables):
        """(exit status, standard output)"""
        run = subprocess.run([os.environ["KEL_PROGRAM"], *arguments], env=self.environment | variables,
                             stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, timeout=120)  # fmt: skip
        return run.returncode, run.stdout.decode()

    def stop(self, number=signal.SIGTERM):
        self.server.send_signal(number)
        status, self.server = self.server.wait(30), None
        return status

    def cached(self):
        """The bytes of the cache file; none when there is no file."""
        return self.cache.read_bytes() if self.cache.exists() else b""

    def log(self):
        return self.log_path.read_text(errors="replace")


@pytest.fixture
def home():
    # Not pytest's own folder: its paths are too long for a socket's name, and it is kept.
    with tempfile.TemporaryDirectory(prefix="kel-") as root:
        made = Home(root)
        try:
            yield made
            assert made.server is None or made.server.poll() is None, f"the server died: {made.log()}"
        finally:
            if made.server is not None:
                made.stop(signal.SIGKILL)


@pytest.fixture
def served(home):
    """The example bundles, a running server, and its first update done."""
    shutil.copytree(EXAMPLES, home.home, dirs_exist_ok=True)
    home.start()
    home.ask(UPDATE)
    return home
