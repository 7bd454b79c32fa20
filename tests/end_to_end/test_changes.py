"""Changes on disk reach clients that only wait for the seed and ask again, as applications do."""

import shutil
import time

from conftest import GET, wait_until


class Watcher:
    """Waits for the seed to move, then asks for the list."""

    def __init__(self, home):
        self.home = home
        self.seen = None

    def seeds(self):
        return {path.name: path.read_bytes() for path in (self.home.run / "kel" / "beacond").glob("*qvservices.seed*")}

    def settle(self):
        """Asks until nothing from the start can move the seed any more: reactions are six seconds apart at most."""
        quiet_since = time.monotonic()
        while time.monotonic() < quiet_since + 7:
            if self.seeds() != self.seen:
                self.seen, quiet_since = self.seeds(), time.monotonic()
                self.home.ask(GET)
            time.sleep(0.02)

    def titles_after_seed(self):
        wait_until(lambda: self.seeds() != self.seen, "the seed to move")
        self.seen = self.seeds()
        return set(self.home.titles())

    def follow_until(self, what, there, gone=frozenset()):
        wait_until(lambda: there <= (titles := self.titles_after_seed()) and not gone & titles, what)


def test_a_change_moves_the_seed_and_the_second_answer_holds_it(served):
    watcher = Watcher(served)
    watcher.settle()
    before = set(served.titles())
    (served.home / "Library" / "Services" / "Word Count.service").rename(served.root / "elsewhere")
    assert watcher.titles_after_seed() == before  # the old list, which is rebuilt now
    assert watcher.titles_after_seed() == before - {"Count Words"}
    served.put_bundle("new.service", "Brand New")
    watcher.follow_until("the new bundle", {"Brand New"})
    served.put_bundle("new.service", "Edited")
    watcher.follow_until("the edited bundle", {"Edited"}, {"Brand New"})


def test_applications_are_followed_and_so_is_what_a_link_leads_to(served):
    watcher = Watcher(served)
    served.put_bundle("Fresh.app", "Fresh", "Applications/Tools")
    served.put_bundle("linked", "Linked", "elsewhere")
    (served.home / "Applications" / "Linked.app").symlink_to(served.home / "elsewhere" / "linked")
    watcher.follow_until("the new applications", {"Fresh", "Linked"})
    served.put_bundle("linked", "Changed", "elsewhere")
    watcher.follow_until("the changed link target", {"Changed"}, {"Linked"})
    shutil.rmtree(served.home / "Applications" / "Tools")
    watcher.follow_until("the removed application", set(), {"Fresh"})


def test_what_changed_while_no_server_ran_is_found_without_being_asked_for(served):
    watcher = Watcher(served)
    wait_until(lambda: (served.state / "journal").exists(), "the journal's index")
    assert served.stop() == 0
    served.put_bundle("meanwhile.service", "Meanwhile")
    shutil.rmtree(served.home / "Applications" / "Draft Speller.app")
    served.start()
    watcher.follow_until("the changes", {"Meanwhile"}, {"Proofread Draft"})
