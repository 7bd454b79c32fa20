"""What clients, the cache file and the published preferences hold, from the example bundles."""

import plistlib

from conftest import FLUSH, GET, wait_until

# (bundle, title, what else matters): in the order of the bundle identifiers.
OFFERED = [
    ("Session Summary.service", "Summarise Session", {"QVRestricted": True}),
    ("Change Case.service", "Change Case/Upper Case", {"QVMessage": "upperCase", "QVPortName": "ChangeCase"}),
    ("Change Case.service", "Change Case/Lower Case", {"QVMessage": "lowerCase"}),
    ("Change Case.service", "Change Case/Title Case", {"QVIcon": None}),
    ("Colour Tray.app", "Pick Colours from Picture", {"QVSendFileTypes": ["image/png", "image/tiff"]}),
    ("Draft Speller.app", "Proofread Draft", {"QVSpellChecker": None}),
    ("Erase Selection.service", "Erase for Good", {"QVRestricted": True}),
    ("Glossary.service", "Show in Glossary", {"QVForbiddenContext": {"QVApplicationIdentifier": "org.example.exam-room"}}),
    ("House Spelling.service", None, {"QVSpellChecker": "HouseSpelling", "QVMessage": "HouseSpelling"}),
    ("Note Slips.service", "Make Note Slip", {"QVKeyEquivalent": {"default": "Y"}}),
    ("Parcel Post.app", "Parcel Post/Send Files", {"QVHost": "parcels.example", "QVTimeout": "10000"}),
    ("Parcel Post.app", "Parcel Post/Print Label", {"QVHost": None}),
    ("Shorten Text.service", "Shorten", {"QVRequiredContext": {"QVWordLimit": 500}, "QVRestricted": None}),
    ("Shorten Text.service", "Keep First Sentence", {"QVRequiredContext": None}),
    ("Table Maker.service", None, {"QVFilter": "tabulate", "QVSupportsDataTranslation": False}),
    ("Word Count.service", "Count Words", {"QVReturnTypes": None}),
]


def test_the_list_from_the_example_bundles(served):
    services = served.services()
    found = [
        (service["QVBundlePath"].rsplit("/", 1)[1], service["QVMenuItem"].get("default"), {key: service.get(key) for key in expected})
        for service, (_, _, expected) in zip(services, OFFERED)
    ]
    assert found == OFFERED and len(services) == len(OFFERED)
    status, printed = served.client("-dump")
    assert (status, printed.count("QVUUID = ")) == (0, len(OFFERED))


def localized(services, title):
    found = next(each for each in services if each["QVMenuItem"].get("default") == title)
    return {name: value for name, value in found["QVMenuItem"].items() if name != "default"}


def test_a_reply_to_localizations_holds_the_translations(served):
    first = served.services({"localizations": ["German", "French"]})
    assert localized(first, "Shorten") == {"German": "Kürzen"}
    assert localized(first, "Show in Glossary") == {"French": "Chercher dans le glossaire"}
    assert localized(first, "Change Case/Upper Case") == {"German": "Schreibweise/Großbuchstaben"}
    keys = next(each["QVKeyEquivalent"] for each in first if each["QVMenuItem"].get("default") == "Shorten")
    assert keys == {"default": "s", "German": "k"}
    second = served.services({"command": "no such command", "localizations": ["Japanese"]})
    assert localized(second, "Proofread Draft") == {"Japanese": "下書きを校正"}
    assert served.services({"localizations": []}) == second


def test_the_list_is_published_with_the_localizations_asked_for(served):
    path = served.state / "preferences" / "com.orvex.ServicesMenu.Services.plist"

    def published():
        return plistlib.loads(path.read_bytes())["QVServices"] if path.exists() else None

    services = served.services({"localizations": ["German"]})
    expected = {"KTVersion": 2, "KTPrincipalLocalizations": ["German"], "KTVendedServices": services}
    wait_until(lambda: published() == expected, "the publication")
    served.ask(FLUSH)
    wait_until(lambda: published() == {"KTVersion": 2, "KTPrincipalLocalizations": [], "KTVendedServices": []}, "the flush")


def test_a_restarted_server_answers_from_the_cache_file(served):
    before = served.ask({"localizations": ["German"]})["data"]
    wait_until(lambda: b"Notizzettel" in served.cached(), "the cache file")
    assert served.stop() == 0
    served.start()
    assert served.ask(GET)["data"] == before
    status, printed = served.client("-dump_cache")
    assert status == 0 and "loc_to_menu_strings = {" in printed
