"""Hostile and clumsy peers, many clients, and ends of every kind."""

import concurrent.futures
import plistlib
import random
import signal
import socket
import subprocess

import pytest
from conftest import DROPPED, FLUSH, GET, REPLY, REQUEST, UPDATE, encode, frame

MANY = 200


@pytest.fixture
def crowded(home):
    """A server over enough bundles that an update takes a while."""
    for number in range(MANY):
        home.put_bundle(f"{number:03}.service", f"Title {number:03}")
    home.start()
    return home


UNKNOWN = [
    {}, {"command": "no such command"}, {"command": "FLUSH"}, {"command": 7}, {"command": ["flush"]},
    {"localizations": "German"}, {"localizations": ["German", 7]}, {"localizations": {"German": "German"}},
    ["flush"], "flush", 7,
]  # fmt: skip


@pytest.mark.parametrize("message", UNKNOWN, ids=str)
def test_a_request_of_no_known_kind_is_dropped_and_logged(home, message):
    home.start()
    peer = home.connect()
    assert peer.ask(message) == DROPPED
    home.expect_log("unknown Conduit message")
    assert peer.ask(GET) != DROPPED, "the connection should go on"


BROKEN = {
    "nothing": b"",
    "half a header": frame(b"")[:7],
    "half a payload": frame(encode(GET))[:-5],
    "a giant length": frame(b"", length=0xFFFFFFFF),
    "a mebibyte and one": frame(b"", length=(1 << 20) + 1),
    "garbage": bytes(range(255, 0, -1)) * 40,
    "text": b"GET / HTTP/1.1\r\n\r\n" * 20,
    "no property list": frame(b"certainly not"),
    "an empty payload": frame(b""),
    "a reply": frame(encode({}), kind=REPLY),
    "a dropped frame": frame(b"", kind=DROPPED),
    "an unknown kind": frame(encode(GET), kind=77),
    "deep nesting": frame(b"(" * 100_000),
    "a request cut by the end": frame(encode(UPDATE)) + frame(encode(UPDATE))[:20],
}


@pytest.mark.parametrize("then_close", [True, False], ids=["closed", "left open"])
def test_a_broken_peer_costs_only_itself(served, then_close):
    peers = []
    expected = served.ask(GET)
    for what, sent in BROKEN.items():
        peers.append(served.connect())
        peers[-1].socket.sendall(sent)
        if then_close:
            peers[-1].socket.close()
        assert served.ask(GET) == expected, what


@pytest.mark.parametrize("what", ["a giant length", "a mebibyte and one", "garbage", "text", "an unknown kind"])
def test_a_peer_that_breaks_the_framing_is_cut_off(home, what):
    home.start()
    peer = home.connect()
    peer.socket.sendall(BROKEN[what])
    assert peer.receive() is None


def test_a_half_message_is_not_waited_for_forever_but_a_silent_client_is_kept(home):
    home.start()
    silent, half = home.connect(), home.connect()
    half.socket.sendall(BROKEN["half a payload"])
    assert half.receive() is None
    assert silent.ask(GET) != DROPPED


def test_a_crowd_of_silent_clients_does_not_keep_others_waiting(served):
    crowd = [served.connect() for _ in range(300)]
    assert served.client("-flush") == (0, "")
    for peer in crowd[::50]:
        assert peer.ask(UPDATE)["data"]


def test_a_client_that_reads_nothing_does_not_hold_up_the_others(crowded):
    crowded.ask(UPDATE)
    deaf = crowded.connect()
    deaf.socket.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, 1)
    deaf.socket.sendall(b"".join(frame(encode(GET), tag=tag) for tag in range(1, 9)))
    assert len(crowded.services()) == MANY
    assert [deaf.receive()[1] for _ in range(8)] == list(range(1, 9))


def test_a_request_that_wants_no_reply_is_performed_and_not_answered(served):
    peer = served.connect()
    peer.socket.sendall(frame(encode(FLUSH), REQUEST, tag=0))
    assert plistlib.loads(peer.ask(GET, tag=9)["data"]) == []


def test_a_message_may_come_byte_by_byte(home):
    home.start()
    peer = home.connect()
    for byte in frame(encode(FLUSH), tag=3):
        peer.socket.sendall(bytes([byte]))
    assert peer.receive() == (REPLY, 3, {})


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


def test_a_dead_servers_socket_is_replaced(home):
    home.start()
    home.stop(signal.SIGKILL)
    assert home.endpoint.exists()
    home.start()
    assert home.ask(GET) != DROPPED
    assert (home.run / "kel").stat().st_mode & 0o777 == 0o700


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


def test_kill_at_any_time_leaves_a_readable_cache_or_none(crowded):
    chance = random.Random(7)
    for _ in range(15):
        peer = crowded.connect()
        peer.socket.sendall(b"".join(frame(encode(UPDATE), tag=tag) for tag in range(1, 5)))
        peer.socket.settimeout(chance.uniform(0.001, 0.06))
        try:
            peer.receive()  # however far the updates come until then
        except TimeoutError:
            pass
        crowded.stop(signal.SIGKILL)
        if cached := crowded.cached():
            assert len(plistlib.loads(cached)["ServicesCache"]) == MANY
        crowded.start()
        assert len(crowded.services()) in (0, MANY)
    crowded.ask(UPDATE)
    assert len(crowded.services()) == MANY
