"""Changes on disk reach clients that only wait for the seed and ask again, as applications do."""

import shutil

from conftest import wait_until


class Watcher:
    """Waits for the seed to move, then asks for the list."""

    def __init__(self, home):
        self.home = home
        self.seen = None

    def seeds(self):
        return {path.name: path.read_bytes() for path in (self.home.run / "kel" / "beacond").glob("*qvservices.seed*")}

    def titles_after_seed(self):
        wait_until(lambda: self.seeds() != self.seen, "the seed to move")
        self.seen = self.seeds()
        return set(self.home.titles())

    def follow_until(self, what, there, gone=frozenset()):
        wait_until(lambda: there <= (titles := self.titles_after_seed()) and not gone & titles, what)


def test_bundles_and_applications_are_followed_and_so_is_what_a_link_leads_to(served):
    watcher = Watcher(served)
    served.put_bundle("new.service", "Brand New")
    served.put_bundle("Fresh.app", "Fresh", "Applications/Tools")
    served.put_bundle("linked", "Linked", "elsewhere")
    (served.home / "Applications" / "Linked.app").symlink_to(served.home / "elsewhere" / "linked")
    watcher.follow_until("the new bundles", {"Brand New", "Fresh", "Linked"})
    served.put_bundle("new.service", "Edited")
    watcher.follow_until("the edited bundle", {"Edited"}, {"Brand New"})
    served.put_bundle("linked", "Changed", "elsewhere")
    watcher.follow_until("the changed link target", {"Changed"}, {"Linked"})
    (served.home / "Library" / "Services" / "Word Count.service").rename(served.root / "elsewhere")
    shutil.rmtree(served.home / "Applications" / "Tools")
    watcher.follow_until("what was removed", set(), {"Count Words", "Fresh"})


def test_what_changed_while_no_server_ran_is_found_without_being_asked_for(served):
    watcher = Watcher(served)
    wait_until(lambda: (served.state / "journal").exists(), "the journal's index")
    assert served.stop() == 0
    served.put_bundle("meanwhile.service", "Meanwhile")
    shutil.rmtree(served.home / "Applications" / "Draft Speller.app")
    served.start()
    watcher.follow_until("the changes", {"Meanwhile"}, {"Proofread Draft"})
