"""Which clients count as sandboxed, and what such a client gets."""

import contextlib
import ctypes
import os
import signal
import socket
import subprocess

import pytest
from conftest import DROPPED, FLUSH, GET, UPDATE, Peer

GERMAN = {"localizations": ["German"]}
# Connects, hands the connection to the test and, as the process that made it, lives until the test lets go.
CLIENT = """
import ctypes, os, socket, sys
os.chdir(os.path.dirname(sys.argv[1]))
exec(os.environ.get("CONFINEMENT", ""))
with socket.socket(socket.AF_UNIX) as made, socket.socket(fileno=int(sys.argv[2])) as test:
    made.connect(os.path.basename(sys.argv[1]))
    socket.send_fds(test, [b"!"], [made.fileno()])
sys.stdin.read()
"""


def drop_inspection():
    """The superuser's processes, too, then see of each other only what an ordinary user's do."""
    ctypes.CDLL(None).prctl(24, 19, 0, 0, 0)  # PR_CAPBSET_DROP, CAP_SYS_PTRACE


@pytest.fixture
def served(home):
    home.start(preexec_fn=drop_inspection)
    return home


@contextlib.contextmanager
def client(home, *confinement):
    """The connection of a process of its own, and the process."""
    ours, theirs = socket.socketpair()
    command = [*confinement, "/usr/bin/python3", "-c", CLIENT, str(home.endpoint), str(theirs.fileno())]
    options = {"stdin": subprocess.PIPE, "pass_fds": [theirs.fileno()], "preexec_fn": drop_inspection}
    with ours, subprocess.Popen(command, **options) as process:
        theirs.close()
        ours.settimeout(30)
        _, (descriptor,), _, _ = socket.recv_fds(ours, 1, 1)
        with socket.socket(fileno=descriptor) as made:
            yield Peer(made), process


def is_refused(peer):
    """Whether the list is all that the peer gets: no update, no flush, no debug output."""
    listed, localized, *others = [peer.ask(request | {"debug": True}) for request in (GET, GERMAN, UPDATE, FLUSH)]
    assert "data" in listed and "data" in localized
    got = [other != DROPPED for other in others] + ["debug_output" in reply for reply in (listed, localized)]
    assert len(set(got)) == 1, got
    return not got[0]


def bubblewrapped(*arguments):
    probe = ["env", "bwrap", "--unshare-user", "--dev-bind", "/", "/", "true"]
    if (answer := subprocess.run(probe, stderr=subprocess.PIPE, text=True)).returncode:
        pytest.skip(f"no user namespaces can be had here: {answer.stderr.strip()}")
    return ["bwrap", *arguments]


def application_runtime(home):
    information = home.root / "information"
    information.write_text("[Application]\nname=org.example.App\n")
    binds = [word for part in ("usr", "etc", "bin", "lib", "lib64") for word in ("--ro-bind-try", f"/{part}", f"/{part}")]
    return bubblewrapped(*binds, "--bind", str(home.root), str(home.root), "--ro-bind", str(information), "/.flatpak-info")


def prepared(statement):
    """Confined by what it does before it connects."""
    return ["env", f"CONFINEMENT={statement}"]


def another_root(home):
    if os.geteuid() != 0:
        pytest.skip("only the superuser may change the root")
    return prepared("os.chroot('/usr')")


CONFINEMENTS = {
    "user namespace": lambda home: bubblewrapped("--unshare-user", "--dev-bind", "/", "/"),
    "application runtime": application_runtime,
    "another root": another_root,
    "not to be inspected": lambda home: prepared("ctypes.CDLL(None).prctl(4, 0, 0, 0, 0)"),  # PR_SET_DUMPABLE
}


@pytest.mark.parametrize("confinement", CONFINEMENTS.values(), ids=CONFINEMENTS)
def test_a_sandboxed_client_gets_lists_and_nothing_else(served, confinement):
    with client(served, *confinement(served)) as (confined, _), client(served) as (unconfined, _):
        assert is_refused(confined) and not is_refused(unconfined)


def test_a_client_that_ended_before_it_was_asked_about_counts_as_sandboxed(served):
    served.server.send_signal(signal.SIGSTOP)
    os.waitid(os.P_PID, served.server.pid, os.WSTOPPED)
    with client(served) as (left_alone, process):
        process.communicate(timeout=30)
        served.server.send_signal(signal.SIGCONT)
        assert is_refused(left_alone)
