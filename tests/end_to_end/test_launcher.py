"""Sockets that the service launcher owns, and what it is told."""

import os
import shutil
import signal
import socket

import pytest
from conftest import DROPPED, FLUSH, GET, REPLY, encode, frame

pytestmark = pytest.mark.skipif(not shutil.which("systemd-socket-activate"), reason="there is no systemd-socket-activate")
# Makes a descriptor the first of those that are passed to the process.
PASS = 'exec 3<&"$0" && LISTEN_PID=$$ LISTEN_FDS=1 exec "$@"'


def test_a_connection_that_waits_in_the_launchers_socket_is_never_lost(home):
    home.endpoint.parent.mkdir(mode=0o700)
    home.environment["NOTIFY_SOCKET"] = str(home.root / "notify")
    kept = [f"--setenv={name}" for name in [*home.environment, "QVRunningFromWarden"]]
    with socket.socket(socket.AF_UNIX) as listening, socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as launcher:
        launcher.bind(home.environment["NOTIFY_SOCKET"])
        launcher.settimeout(30)
        listening.bind(str(home.endpoint))
        listening.listen()
        # The launcher makes the server of itself at the first connection.
        command = ["bash", "-c", PASS, str(listening.fileno()), "systemd-socket-activate", f"--fdname={home.endpoint.name}", *kept]
        for _ in range(5):
            waiting = home.connect()
            waiting.socket.sendall(frame(encode(GET)))
            if home.server:
                assert home.stop(signal.SIGCONT) == 0
            with open(home.log_path, "ab") as log:
                home.server = home.spawn(*command, stderr=log, pass_fds=[listening.fileno()])
            assert waiting.receive()[0] == REPLY
            assert home.ask(FLUSH) != DROPPED
            # The next connection comes when the server has been told to end and could not yet.
            home.server.send_signal(signal.SIGSTOP)
            os.waitid(os.P_PID, home.server.pid, os.WSTOPPED)
            home.server.send_signal(signal.SIGTERM)
        assert launcher.recv(100).startswith(b"READY=1\nSTATUS=")
    assert home.stop(signal.SIGCONT) == 0
    assert home.endpoint.exists(), "the launcher's socket file was removed"
