"""Descriptors that come unasked, many clients, and ends of every kind."""

import concurrent.futures
import os
import select
import signal
import socket
import subprocess

import pytest
from conftest import DROPPED, GET, UPDATE, encode, frame

MANY = 200


@pytest.fixture
def crowded(home):
    """A server over enough bundles that an update takes a while."""
    for number in range(MANY):
        home.put_bundle(f"{number:03}.service", f"Title {number:03}")
    home.start()
    return home


def test_descriptors_that_somebody_sends_are_closed_at_once(home):
    home.start()
    peer = home.connect()
    ours, theirs = os.pipe()
    socket.send_fds(peer.socket, [frame(encode(GET))], [theirs])
    os.close(theirs)
    assert peer.receive()
    assert select.select([ours], [], [], 30)[0], "the server still has the descriptor"
    os.close(ours)


def test_clients_at_the_same_time_are_all_served(crowded):
    crowded.ask(UPDATE)
    actions = [["-dump"], ["-update"], ["-dump", "-debug"], ["German"], ["-update", "-dump"]] * 4
    with concurrent.futures.ThreadPoolExecutor(len(actions)) as pool:
        for arguments, (status, printed) in zip(actions, pool.map(lambda each: crowded.client(*each), actions)):
            assert (status, printed.count("QVUUID = ")) == (0, 0 if arguments == ["-update"] else MANY), arguments


def test_a_second_server_says_so_and_leaves_the_first_alone(home):
    home.start()
    second = home.spawn(stdout=subprocess.PIPE, stderr=subprocess.STDOUT)
    told, _ = second.communicate(timeout=30)
    assert (second.returncode, told.count(b"\n")) == (0, 1)
    assert home.ask(GET) != DROPPED


@pytest.mark.parametrize("busy", [False, True], ids=["idle", "updating"])
def test_the_termination_signal_ends_the_server_with_status_0(crowded, busy):
    peer = crowded.connect()
    if busy:
        peer.socket.sendall(frame(encode(UPDATE)))
    assert crowded.stop() == 0
    if busy:
        while peer.receive():
            pass
    assert crowded.client("-dump") == (0, "Conduit message error: Connection invalid\n")
