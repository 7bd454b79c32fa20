"""The command line of the built program: what is printed, and the exit status."""

import pytest

USAGE = "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...\n"
NO_SERVER = "Conduit message error: Connection invalid\n"
NO_SERVICES = "No services (com.orvex.ServicesMenu.Services missing or empty in QVServices preferences)\n"
MOCKED = "Mocking complete\n"


def test_without_a_server_every_action_still_has_its_turn(home):
    status, printed = home.client(*"en -gen -dump_c -mockar --f fr -update -dump".split())
    assert printed == NO_SERVER * 3 + MOCKED + f"Couldn't read {home.cache}\n" + NO_SERVICES + NO_SERVER
    assert status == 0


def test_names_that_are_not_utf8_are_skipped(served):
    assert served.client(b"\xff\xfe", "German")[1] == served.client("German")[1] != USAGE


@pytest.mark.parametrize("value", ["", "0", "true", "1 ", "01", "11"])
def test_any_other_value_of_the_variable_leaves_a_client(home, value):
    assert home.client(QVRunningFromWarden=value) == (1, USAGE)
