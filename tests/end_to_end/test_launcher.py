"""Sockets that the service launcher owns, and what it is told."""

import contextlib
import os
import shutil
import signal
import socket

import pytest
from conftest import DROPPED, FLUSH, GET, REPLY, UPDATE, encode, frame, wait_until

pytestmark = pytest.mark.skipif(not shutil.which("systemd-socket-activate"), reason="there is no systemd-socket-activate")
# Makes a descriptor the first of those that are passed to the process.
PASS = 'exec 3<&"$0" && LISTEN_PID=$$ LISTEN_FDS=1 exec "$@"'


def activate(home, *passing, listen=(), **options):
    """Has the launcher become the server at the first connection."""
    kept = [f"--setenv={name}" for name in [*home.environment, "QVRunningFromWarden"]]
    command = [*passing, "systemd-socket-activate", f"--fdname={home.endpoint.name}", *kept, *listen]
    with open(home.log_path, "ab") as log:
        home.server = home.spawn(*command, stderr=log, **options)


def test_a_connection_that_waits_in_the_launchers_socket_is_never_lost(home):
    home.endpoint.parent.mkdir(mode=0o700)
    with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as listening:
        listening.bind(str(home.endpoint))
        listening.listen()
        for _ in range(5):
            waiting = home.connect()
            waiting.socket.sendall(frame(encode(GET)))
            if home.server:
                assert home.stop(signal.SIGCONT) == 0
            activate(home, "bash", "-c", PASS, str(listening.fileno()), pass_fds=[listening.fileno()])
            assert waiting.receive()[0] == REPLY
            assert home.ask(FLUSH) != DROPPED
            # The next connection comes when the server has been told to end and could not yet.
            home.server.send_signal(signal.SIGSTOP)
            os.waitid(os.P_PID, home.server.pid, os.WSTOPPED)
            home.server.send_signal(signal.SIGTERM)


def test_the_launcher_hears_of_readiness_and_then_how_many_transactions_are_open(home):
    home.endpoint.parent.mkdir(mode=0o700)
    reports = []
    with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as launcher:
        launcher.bind(home.environment.setdefault("NOTIFY_SOCKET", str(home.root / "notify")))
        launcher.setblocking(False)

        def last():
            with contextlib.suppress(BlockingIOError):
                while True:
                    reports.append(launcher.recv(100).decode())
            return reports[-1:]

        activate(home, listen=["--listen", str(home.endpoint)])
        wait_until(home.connects, "the server")
        idle = ["STATUS=0 open transactions"]
        wait_until(lambda: home.ask(UPDATE) and last() not in ([], idle) and len(reports) > 1, "open transactions")
        wait_until(lambda: last() == idle, "the end of the work")
    assert reports[0].startswith("READY=1\nSTATUS=") and not any("READY" in report for report in reports[1:])
    assert home.stop() == 0
    assert home.endpoint.exists(), "the launcher's socket file was removed"
