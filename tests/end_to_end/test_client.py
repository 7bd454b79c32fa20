"""The command line: what is asked, in which order, what is printed, and the exit status."""

import re
import socket
import threading
import types

import pytest
from conftest import DROPPED, FLUSH, GET, REPLY, UPDATE, Peer, encode, frame

USAGE = "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...\n"
NO_SERVER = "Conduit message error: Connection invalid\n"
NO_SERVICES = "No services (com.orvex.ServicesMenu.Services missing or empty in QVServices preferences)\n"
MOCKED = "Mocking complete\n"
ANSWER = {"data": encode("reply"), "debug_output": "told\nthat"}
FULL, DEBUG_ONLY = "told\nthat\nreply\n", "told\nthat\n"


def localizations(*names):
    return {"localizations": list(names)}


@pytest.fixture
def answering(home):
    """A stand-in for the server: notes each request and answers it with the bytes of `answer`."""
    state = types.SimpleNamespace(requests=[], answer=lambda tag: frame(encode(ANSWER), REPLY, tag))
    home.endpoint.parent.mkdir(mode=0o700)
    listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
    listener.bind(str(home.endpoint))
    listener.listen()

    def serve():
        try:
            while True:
                peer = Peer(listener.accept()[0])
                with peer.socket:
                    _, tag, request = peer.receive()
                    state.requests.append(request)
                    peer.socket.sendall(state.answer(tag))
        except OSError:
            return

    thread = threading.Thread(target=serve)
    thread.start()
    yield state
    listener.shutdown(socket.SHUT_RDWR)
    thread.join(30)
    listener.close()


BAD = ["", "-debug", "-bogus -help", "-dump -bogus", "-dump=1", "-dum", "-dump_", "-d", "-f", "--d", "-", "-dump -- -fr"]
GOOD = [
    ("-help", USAGE, []),
    ("-dump -flush --he", USAGE, []),
    ("-dump", FULL, [GET]),
    ("--dump_p -dump", FULL, [GET]),
    ("--f", DEBUG_ONLY, [FLUSH]),
    ("-fl", DEBUG_ONLY, [FLUSH]),
    ("-update -deb", DEBUG_ONLY, [UPDATE | {"debug": True}]),
    ("en -debug", FULL, [localizations("en") | {"debug": True}]),
    ("-- en", FULL, [localizations("en")]),
    ("en -dump fr", FULL + FULL, [GET, localizations("en", "fr")]),
    ("en -flush -dump", FULL + DEBUG_ONLY + FULL, [GET, FLUSH, localizations("en")]),
    (
        "en -gen -dump_c -mockar -flush -update -dump",
        FULL + DEBUG_ONLY + DEBUG_ONLY + MOCKED + "Couldn't read {cache}\n" + NO_SERVICES + FULL,
        [GET, UPDATE, FLUSH, localizations("en")],
    ),
]


ROWS = [(arguments, 1, USAGE, []) for arguments in BAD] + [(arguments, 0, *expected) for arguments, *expected in GOOD]


@pytest.mark.parametrize("arguments, status, printed, requests", ROWS, ids=[row[0] or "(none)" for row in ROWS])
def test_the_command_line(home, answering, arguments, status, printed, requests):
    assert home.client(*arguments.split()) == (status, printed.format(cache=home.cache))
    assert answering.requests == requests


def test_a_name_that_is_not_utf8_is_skipped(home, answering):
    assert home.client(b"\xff\xfe") == (1, USAGE)
    assert home.client(b"\xff\xfe", "en") == (0, FULL)
    assert answering.requests == [localizations("en")]


@pytest.mark.parametrize(
    "answer, printed",
    [
        (lambda tag: frame(encode({}), REPLY, tag), ""),
        (lambda tag: frame(encode({"data": "no data", "debug_output": 1}), REPLY, tag), ""),
        (lambda tag: frame(encode({"data": b"bplist00", "debug_output": ""}), REPLY, tag), r"\nError decoding property list: .+\n"),
        (lambda tag: frame(encode(["odd"]), REPLY, tag), r"\w+: unknown Conduit message type 0x[0-9a-f]+ for reply: (.|\n)*odd(.|\n)*\n"),
        (lambda tag: frame(b"", DROPPED, tag), "Conduit message error: Connection interrupted\n"),
        (lambda tag: frame(encode({}), REPLY, tag)[:-1], "Conduit message error: Connection interrupted\n"),
        (lambda tag: b"", "Conduit message error: Connection interrupted\n"),
    ],
    ids=["empty", "wrong types", "undecodable", "no dictionary", "dropped", "half a reply", "closed"],
)
def test_what_a_reply_prints(home, answering, answer, printed):
    answering.answer = answer
    status, output = home.client("-dump")
    assert status == 0
    assert re.fullmatch(printed, output)


def test_without_a_server_every_action_still_has_its_turn(home):
    assert home.client("-dump", "-update", "-flush", "-mockar", "en") == (0, NO_SERVER * 3 + MOCKED + NO_SERVER)


@pytest.mark.parametrize("value", ["", "0", "true", "1 ", "01"])
def test_any_other_value_of_the_variable_leaves_a_client(home, value):
    assert home.client(QVRunningFromWarden=value) == (1, USAGE)
