"""The command line of the built program: what is printed, and the exit status."""

import pytest

USAGE = "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...\n"
NO_SERVER = "Conduit message error: Connection invalid\n"
NO_SERVICES = "No services (com.orvex.ServicesMenu.Services missing or empty in QVServices preferences)\n"
MOCKED = "Mocking complete\n"
LATER = MOCKED + "Couldn't read {cache}\n" + NO_SERVICES + NO_SERVER
ROWS = [
    ("", 1, USAGE),
    ("-debug", 1, USAGE),
    ("-dump -bogus", 1, USAGE),
    ("-dump=1", 1, USAGE),
    ("-dump -- -fr", 1, USAGE),
    ("-dump -flush --he", 0, USAGE),
    ("-- en", 0, NO_SERVER),
    ("en -gen -dump_c -mockar --f fr -update -dump", 0, NO_SERVER * 3 + LATER),
]


@pytest.mark.parametrize("arguments, status, printed", ROWS, ids=[row[0] or "(none)" for row in ROWS])
def test_without_a_server_every_action_still_has_its_turn(home, arguments, status, printed):
    assert home.client(*arguments.split()) == (status, printed.format(cache=home.cache))


def test_names_that_are_not_utf8_are_skipped(served):
    assert served.client(b"\xff\xfe") == (1, USAGE)
    assert served.client(b"\xff\xfe", "German")[1] == served.client("German")[1] != USAGE


@pytest.mark.parametrize("value", ["", "0", "true", "1 ", "01"])
def test_any_other_value_of_the_variable_leaves_a_client(home, value):
    assert home.client(QVRunningFromWarden=value) == (1, USAGE)
