"""The Extensions panel for real: the program under Xvfb against spawnd and a signed axd on a
private root, driven through the accessibility bus as a screen reader would drive it.

Run by ctest as `dbus-run-session -- xvfb-run -a python3 -m pytest` with ANNEXA_BIN naming a
build's bin directory; screenshots go to PANEL_ARTIFACTS (default: a directory under the test's
temporary root, printed)."""

from __future__ import annotations

import os
import pathlib
import shutil
import subprocess
import time
from typing import Any, Callable, Iterator, Optional, TypeVar
from xml.sax.saxutils import escape

import pyatspi
import pytest

T = TypeVar("T")


def plist(value: Any, indent: str = "") -> str:
    """A property list in XML, without a document type line."""
    if isinstance(value, bool):
        return f"{indent}<{'true' if value else 'false'}/>\n"
    if isinstance(value, str):
        return f"{indent}<string>{escape(value)}</string>\n"
    if isinstance(value, dict):
        inner = "".join(f"{indent}\t<key>{escape(k)}</key>\n" + plist(v, indent + "\t") for k, v in value.items())
        return f"{indent}<dict>\n{inner}{indent}</dict>\n"
    raise TypeError(type(value).__name__)


def write_plist(path: pathlib.Path, value: dict[str, Any]) -> None:
    path.write_text('<?xml version="1.0" encoding="UTF-8"?>\n<plist version="1.0">\n' + plist(value) + "</plist>\n")


def program(name: str) -> str:
    found = os.path.join(os.environ["ANNEXA_BIN"], name) if os.environ.get("ANNEXA_BIN") else shutil.which(name)
    assert found and os.access(found, os.X_OK), f"{name} not found (set ANNEXA_BIN)"
    return found


def eventually(what: Callable[[], Optional[T]], description: str, seconds: float = 10) -> T:
    deadline = time.monotonic() + seconds
    while True:
        found = what()
        if found:
            return found
        if time.monotonic() > deadline:
            pytest.fail(f"never: {description}")
        time.sleep(0.02)


class Platform:
    def __init__(self, root: pathlib.Path) -> None:
        self.root = root
        self.processes: list[subprocess.Popen[bytes]] = []

    def tool(self, name: str, *arguments: str) -> str:
        done = subprocess.run([program(name), *arguments], capture_output=True, text=True)
        assert done.returncode == 0, f"{name} {' '.join(arguments)}: {done.stderr}"
        return done.stdout

    def signed(self, name: str, entitlements: dict[str, Any]) -> pathlib.Path:
        copy = self.root / "bin" / name
        shutil.copy(program(name), copy)
        write_plist(self.root / f"{name}.plist", entitlements)
        self.tool("axsign", "sign", "--key", str(self.root / "key"), "--entitlements", str(self.root / f"{name}.plist"), str(copy))
        return copy

    def start(self, command: list[str], log: str, endpoint: Optional[str] = None) -> subprocess.Popen[bytes]:
        with open(self.root / log, "wb") as out:
            process = subprocess.Popen(command, stderr=out, stdout=out)
        self.processes.append(process)
        if endpoint:
            rpx = self.root / "run" / "user" / str(os.getuid()) / "rpx" / endpoint
            eventually(rpx.exists, f"{command[0]} listens")
        return process

    def application(self, name: str, plugins: dict[str, dict[str, Any]]) -> pathlib.Path:
        """An application with plug-ins (by display name, with extra Info.plist entries), registered."""
        app = self.root / "Applications" / f"{name}.app"
        (app / "PlugIns").mkdir(parents=True)
        write_plist(app / "Info.plist", {
            "KFBundleIdentifier": f"com.example.{name.lower()}", "KFBundleExecutable": "app", "KFBundleName": name,
            "KFBundleShortVersionString": "1.0", "KFBundleVersion": "1", "KFBundlePackageType": "APP!"})
        shutil.copy("/bin/true", app / "app")
        for plugin, extra in plugins.items():
            bundle = app / "PlugIns" / f"{plugin.replace(' ', '')}.appex"
            bundle.mkdir()
            point = extra.pop("point", "com.example.share")
            info = {
                "KFBundleIdentifier": f"com.example.{name.lower()}.{plugin.replace(' ', '').lower()}",
                "KFBundleExecutable": "plugin", "KFBundleDisplayName": plugin,
                "KFBundleShortVersionString": "2.1", "KFBundleVersion": "1", "KFBundlePackageType": "RPX!",
                "KSExtension": {"KSExtensionPointIdentifier": point, **extra}}
            write_plist(bundle / "Info.plist", info)
            shutil.copy("/bin/true", bundle / "plugin")
        self.tool("axctl", "add", str(app))
        return app


@pytest.fixture(scope="module")
def platform(tmp_path_factory: pytest.TempPathFactory) -> Iterator[Platform]:
    root = tmp_path_factory.mktemp("root")
    os.environ["CORVANE_ROOT"] = str(root)
    p = Platform(root)
    (root / "bin").mkdir()
    # The platform's own extension points, with their names.
    sdk = pathlib.Path(__file__).resolve().parents[3] / "dist" / "sdk"
    if sdk.is_dir():
        shutil.copytree(sdk, root / "usr" / "share" / "corvane" / "sdk")
    p.tool("axsign", "keygen", "--out", str(root / "key"))
    p.tool("axsign", "trust", str(root / "key.pub"))
    axd = p.signed("axd", {"com.corvane.private.rpx.domain-extension.proxy": True, "com.corvane.private.pcx.manager": True})
    p.start([program("spawnd")], "spawnd.log", "com.corvane.spawnd")
    p.start([str(axd)], "axd.log", "com.corvane.annexa.axd")
    try:
        yield p
    finally:
        for process in reversed(p.processes):
            process.terminate()
            process.wait(timeout=10)


def panel_application(process: subprocess.Popen[bytes]) -> Any:
    for app in pyatspi.Registry.getDesktop(0):
        if app is not None and app.get_process_id() == process.pid:
            return app
    return None


def find_all(root: Any, test: Callable[[Any], bool]) -> list[Any]:
    found: list[Any] = []

    def walk(node: Any, depth: int) -> None:
        if node is None or depth > 60:
            return
        try:
            if test(node):
                found.append(node)
            for child in node:
                walk(child, depth + 1)
        except Exception:  # a widget that went while the tree was read
            pass

    walk(root, 0)
    return found


def named(root: Any, name: str, roles: tuple[int, ...] = ()) -> Any:
    hits = find_all(root, lambda n: n.name == name and (not roles or n.getRole() in roles)
                    and n.getState().contains(pyatspi.STATE_VISIBLE))
    return hits[0] if hits else None


def act(node: Any) -> None:
    action = node.queryAction()
    names = [action.getName(i) for i in range(action.nActions)]
    action.doAction(names.index("activate") if "activate" in names else 0)


def checked(node: Any) -> bool:
    states = node.getState()
    return bool(states.contains(pyatspi.STATE_CHECKED) or states.contains(pyatspi.STATE_PRESSED))


def screenshot(directory: pathlib.Path, name: str) -> pathlib.Path:
    path = directory / name
    subprocess.run(["import", "-window", "root", str(path)], check=True)
    # Not blank: a window of text and controls has many colours; an empty screen has one.
    colours = int(subprocess.run(["identify", "-format", "%k", str(path)], capture_output=True, text=True, check=True).stdout)
    assert colours > 16, f"{path} looks blank ({colours} colours)"
    return path


def elected(platform: Platform) -> str:
    return platform.tool("axctl", "match", "-r", "KSUserElection=1")


SWITCHES = (pyatspi.ROLE_TOGGLE_BUTTON, getattr(pyatspi, "ROLE_SWITCH", pyatspi.ROLE_TOGGLE_BUTTON), pyatspi.ROLE_CHECK_BOX)


def test_the_panel_shows_elects_follows_and_explains(platform: Platform, tmp_path: pathlib.Path) -> None:
    platform.application("Mailer", {"Send by Mail": {"KSExtensionAttributes": {"KSExtensionPointName": "Share"}},
                                    "Own Preview": {"point": "com.corvane.glancer.extension.preview", "Dedicated": True}})
    platform.application("Notes", {"Quick Note": {"KSExtensionAttributes": {"KSExtensionPointName": "Share"}}})
    platform.application("Keys", {"Emoji Keys": {"point": "com.corvane.keyboard-service",
                                                 "KSExtensionAttributes": {"RequestsOpenAccess": True}}})
    panel_program = platform.signed("annexa-extensions", {"com.corvane.private.annexa.manager": True})
    artifacts = pathlib.Path(os.environ.get("PANEL_ARTIFACTS", tmp_path))
    artifacts.mkdir(parents=True, exist_ok=True)
    environment = dict(os.environ, GTK_A11Y="atspi", GDK_BACKEND="x11", ADW_DISABLE_PORTAL="1", GSETTINGS_BACKEND="memory",
                       NO_AT_BRIDGE="0", LANG="C.UTF-8")
    with open(platform.root / "panel.log", "wb") as log:
        process = subprocess.Popen([str(panel_program)], env=environment, stdout=log, stderr=log)
    platform.processes.append(process)
    app = eventually(lambda: panel_application(process), "the panel on the accessibility bus", 30)

    # Every plug-in, the dedicated one too (the panel is the manager), by its name.
    mail_switch = eventually(lambda: named(app, "Use Send by Mail", SWITCHES), "the switch of Send by Mail")
    assert named(app, "Use Own Preview", SWITCHES), "a dedicated plug-in is shown to the manager"
    assert named(app, "Use Quick Note", SWITCHES)
    assert not checked(mail_switch)

    # Flipping the switch elects the plug-in in axd; the row then shows what axd stored.
    act(mail_switch)
    eventually(lambda: "com.example.mailer.sendbymail" in elected(platform), "axd stores the election")
    eventually(lambda: checked(named(app, "Use Send by Mail", SWITCHES)), "the switch shows the stored election")
    assert "com.example.notes.quicknote" not in elected(platform)

    # An election changed elsewhere shows without a refresh.
    note = next(line.split()[0] for line in platform.tool("axctl", "match").splitlines() if "quicknote" in line)
    note_switch = named(app, "Use Quick Note", SWITCHES)
    platform.tool("axctl", "annotate", "--election", "1", note)
    started = time.monotonic()
    eventually(lambda: checked(note_switch), "an election made by axctl shows")
    print(f"an election made by axctl showed {1000 * (time.monotonic() - started):.0f} ms after axctl ended")

    # An application installed while the panel is open shows its plug-in.
    platform.application("Painter", {"Paint Share": {"KSExtensionAttributes": {"KSExtensionPointName": "Share"}}})
    started = time.monotonic()
    eventually(lambda: named(app, "Use Paint Share", SWITCHES), "the new application's plug-in shows")
    print(f"a new application's row showed {1000 * (time.monotonic() - started):.0f} ms after axctl add ended "
          "(with one walk of the accessible tree)")

    # The search keeps what fits.
    search = eventually(lambda: named(app, "Search plug-ins"), "the search field")
    search.queryEditableText().setTextContents("mail")
    eventually(lambda: named(app, "Use Quick Note", SWITCHES) is None, "the search hides what does not fit")
    assert named(app, "Use Send by Mail", SWITCHES)
    search.queryEditableText().setTextContents("")
    eventually(lambda: named(app, "Use Quick Note", SWITCHES), "an empty search shows everything")
    shot = screenshot(artifacts, "extensions-panel.png")

    # Why is it not offered? The panel is no application: the dedicated plug-in serves only its own.
    act(eventually(lambda: named(app, "Why is it not offered?", (pyatspi.ROLE_TOGGLE_BUTTON, pyatspi.ROLE_RADIO_BUTTON,
                                                                  pyatspi.ROLE_PAGE_TAB, pyatspi.ROLE_PUSH_BUTTON)),
                   "the view switcher's button"))
    explain = eventually(lambda: named(app, "Explain", (pyatspi.ROLE_PUSH_BUTTON,)), "the Explain button")
    act(explain)
    eventually(lambda: named(app, "Not offered: it serves only its own application"), "the dedicated plug-in's explanation")
    assert find_all(app, lambda n: n.name == "Offered")
    # A host's rules, typed: what the host asks for and what the user turned on decide.
    rules = eventually(lambda: find_all(app, lambda n: n.name.startswith("Host rules") and n.getRole() == pyatspi.ROLE_TEXT),
                       "the rules field")[0]
    rules.queryEditableText().setTextContents('{"KSExtensionPointName": "Share", "KSUserElection": "1"}')
    act(explain)
    eventually(lambda: named(app, "Not offered: the host asks only for plug-ins you turned on, and this one is off"),
               "Paint Share is off")
    eventually(lambda: named(app, 'Not offered: the host asks for KSExtensionPointName to be "Share", and this plug-in\'s is not'),
               "the keyboard is no share plug-in")
    why = screenshot(artifacts, "extensions-why.png")
    print(f"screenshots: {shot} {why}")

    # A plug-in's page: its sandbox, and the network its keyboard asks for, granted with a switch.
    act(eventually(lambda: named(app, "Plug-ins", (pyatspi.ROLE_PAGE_TAB,)), "the plug-ins view"))
    act(eventually(lambda: named(app, "Details of Emoji Keys", (pyatspi.ROLE_PUSH_BUTTON,)), "the keyboard's details button"))
    network = eventually(lambda: named(app, "Allow Network for its keyboard", SWITCHES), "the keyboard's network switch")
    assert find_all(app, lambda n: n.name.startswith("Profile ")), "the page names the sandbox profile"
    assert "granted" not in platform.tool("pcx", "list")
    act(network)
    eventually(lambda: "com.corvane.pcx.keyboard-network\tgranted" in platform.tool("pcx", "list"), "the network is granted")
    eventually(lambda: named(app, "Profile plugin"), "the page shows the profile the keyboard gets now")
    process.terminate()
    process.wait(timeout=10)
