"""The command line of the built program: what is printed, and the exit status."""

import pytest

USAGE = "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...\n"


def test_names_that_are_not_utf8_are_skipped(served):
    assert served.client(b"\xff\xfe", "German")[1] == served.client("German")[1] != USAGE


@pytest.mark.parametrize("value", ["", "0", "true", "1 ", "01", "11"])
def test_any_other_value_of_the_variable_leaves_a_client(home, value):
    assert home.client(QVRunningFromWarden=value) == (1, USAGE)
