"""Changes on disk reach clients that only wait for the seed and ask again, as applications do."""

import shutil
import time

from conftest import GET, encode, wait_until


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

    def follow_until(self, condition, what):
        wait_until(lambda: condition(self.titles_after_seed()), what)


def declare(title):
    return encode({"KTBundleIdentifier": f"org.example.{title}", "QVServices": [{"QVMessage": "go", "QVMenuItem": {"default": title}}]})


def test_a_change_moves_the_seed_and_the_second_answer_holds_it(served):
    services = served.home / "Library" / "Services"
    watcher = Watcher(served)
    watcher.settle()
    before = set(served.titles())
    services.joinpath("Word Count.service").rename(served.root / "elsewhere")
    assert watcher.titles_after_seed() == before  # the old list, which is rebuilt now
    assert watcher.titles_after_seed() == before - {"Count Words"}
    served.put_bundle("new.service", "Brand New")
    watcher.follow_until(lambda titles: "Brand New" in titles, "the new bundle")
    (services / "new.service" / "Info.plist").write_bytes(declare("Edited"))
    watcher.follow_until(lambda titles: "Edited" in titles and "Brand New" not in titles, "the edited bundle")
    (services / "new.service").rename(services / "other.service")
    paths = lambda: {service["QVBundlePath"].rsplit("/", 1)[1] for service in served.services()}
    watcher.follow_until(lambda _: "other.service" in paths() and "new.service" not in paths(), "the renamed bundle")


def test_applications_are_followed_and_so_is_what_a_link_leads_to(served):
    watcher = Watcher(served)
    linked = served.root / "kept elsewhere"
    linked.mkdir()
    (linked / "Info.plist").write_bytes(declare("Linked"))
    application = served.home / "Applications" / "Tools" / "Fresh.app"
    application.mkdir(parents=True)
    (application / "Info.plist").write_bytes(declare("Fresh"))
    (served.home / "Applications" / "Linked.app").symlink_to(linked)
    watcher.follow_until(lambda titles: {"Fresh", "Linked"} <= titles, "the new applications")
    (linked / "Info.plist").write_bytes(declare("Changed"))
    watcher.follow_until(lambda titles: "Changed" in titles and "Linked" not in titles, "the changed link target")
    shutil.rmtree(application)
    watcher.follow_until(lambda titles: "Fresh" not in titles, "the removed application")


def test_a_bundle_that_is_unpacked_slowly_ends_up_complete(served):
    watcher = Watcher(served)
    bundle = served.home / "Library" / "Services" / "large.service"
    declared = declare("Large")
    bundle.mkdir()
    with open(bundle / "Info.plist", "wb", buffering=0) as file:
        for at in range(0, len(declared), len(declared) // 4):
            file.write(declared[at : at + len(declared) // 4])
            assert "Large" not in set(served.titles()) or at + len(declared) // 4 >= len(declared)
            time.sleep(0.3)
    (bundle / "Resources" / "German").mkdir(parents=True)
    (bundle / "Resources" / "German" / "ServicesMenu.strings").write_text('"Large" = "Gross";')
    watcher.follow_until(lambda titles: "Large" in titles, "the whole bundle")
    served.ask({"localizations": ["German"]})
    large = next(each for each in served.services() if each["QVMenuItem"]["default"] == "Large")
    assert large["QVMenuItem"]["German"] == "Gross"


def test_directories_that_appear_later_are_watched(home):
    home.start()
    watcher = Watcher(home)
    home.ask(GET)
    home.put_bundle("first.service", "First")  # makes ~/Library and ~/Library/Services
    watcher.follow_until(lambda titles: titles == {"First"}, "the first service directory")
    elsewhere = home.root / "elsewhere"
    (home.home / "Library").rename(elsewhere)
    watcher.follow_until(lambda titles: not titles, "its disappearance")
    (home.home / "Library").symlink_to(elsewhere)
    watcher.follow_until(lambda titles: titles == {"First"}, "the directory behind a link")
    (elsewhere / "Services" / "first.service" / "Info.plist").write_bytes(declare("Second"))
    watcher.follow_until(lambda titles: titles == {"Second"}, "the change behind the link")


def test_what_changed_while_no_server_ran_is_found_without_being_asked_for(served):
    watcher = Watcher(served)
    wait_until(lambda: (served.state / "journal").exists(), "the journal's index")
    assert served.stop() == 0
    served.put_bundle("meanwhile.service", "Meanwhile")
    shutil.rmtree(served.home / "Applications" / "Draft Speller.app")
    served.start()
    watcher.follow_until(lambda titles: "Meanwhile" in titles and "Proofread Draft" not in titles, "the changes")
