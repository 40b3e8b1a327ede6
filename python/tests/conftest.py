"""A private platform for the package's tests: spawnd and a signed axd on a root of their own, and
applications whose plug-ins are written in Python.

The programs come from ANNEXA_BIN (a build tree's bin directory) or PATH (an installed system). The
library is the one ANNEXA_LIBRARY names, or the installed libannexa.so.1; a plug-in carries a copy
of what its sandbox could not otherwise read."""

from __future__ import annotations

import os
import pathlib
import shutil
import subprocess
import time
from typing import Any, Iterator, Optional
from xml.sax.saxutils import escape

import pytest

PACKAGE = pathlib.Path(__import__("annexa").__file__).parent

PLUGIN_SOURCE = '''#!/usr/bin/python3
import os
import sys

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))  # a copy of annexa the bundle carries
import annexa.plugin


def handle(message):
    what = message.get("do") if isinstance(message, dict) else None
    if what == "fail":
        raise RuntimeError("asked to fail")
    if what == "busy":
        annexa.plugin.begin_busy("written in Python")
    return {"echo": message, "pid": os.getpid()}


annexa.plugin.run(handle)
'''


def plist(value: Any, indent: str = "") -> str:
    """A property list in XML, without a document type line."""
    if isinstance(value, bool):
        return f"{indent}<{'true' if value else 'false'}/>\n"
    if isinstance(value, int):
        return f"{indent}<integer>{value}</integer>\n"
    if isinstance(value, str):
        return f"{indent}<string>{escape(value)}</string>\n"
    if isinstance(value, dict):
        inner = "".join(f"{indent}\t<key>{escape(k)}</key>\n" + plist(v, indent + "\t") for k, v in value.items())
        return f"{indent}<dict>\n{inner}{indent}</dict>\n"
    if isinstance(value, list):
        return f"{indent}<array>\n" + "".join(plist(v, indent + "\t") for v in value) + f"{indent}</array>\n"
    raise TypeError(type(value).__name__)


def write_plist(path: pathlib.Path, value: dict[str, Any]) -> None:
    path.write_text('<?xml version="1.0" encoding="UTF-8"?>\n<plist version="1.0">\n' + plist(value) + "</plist>\n")


def program(name: str) -> str:
    directory = os.environ.get("ANNEXA_BIN")
    found = os.path.join(directory, name) if directory else shutil.which(name)
    if not found or not os.access(found, os.X_OK):
        pytest.fail(f"{name} not found (set ANNEXA_BIN to a build's bin directory, or install annexa)")
    return found


class Platform:
    def __init__(self, root: pathlib.Path) -> None:
        self.root = root
        self.processes: list[subprocess.Popen[bytes]] = []
        self.rpx = root / "run" / "user" / str(os.getuid()) / "rpx"

    def tool(self, name: str, *arguments: str, check: bool = True) -> subprocess.CompletedProcess[str]:
        return subprocess.run([program(name), *arguments], capture_output=True, text=True, check=check)

    def start(self, command: list[str], endpoint: str, log: str) -> None:
        with open(self.root / log, "wb") as out:
            self.processes.append(subprocess.Popen(command, stderr=out, stdout=subprocess.DEVNULL))
        for _ in range(200):
            if (self.rpx / endpoint).exists():
                return
            time.sleep(0.025)
        pytest.fail(f"{command[0]} did not listen on {endpoint}: {(self.root / log).read_text()}")

    def stop(self) -> None:
        for process in reversed(self.processes):
            process.terminate()
            process.wait(timeout=10)

    def application(self, name: str, plugins: list[str]) -> pathlib.Path:
        """An application with Python plug-ins of these names, for the extension point
        com.example.greeting, registered."""
        app = self.root / "Applications" / f"{name}.app"
        app.mkdir(parents=True)
        write_plist(app / "Info.plist", {
            "KFBundleIdentifier": f"com.example.{name.lower()}", "KFBundleExecutable": "app",
            "KFBundleShortVersionString": "1.0", "KFBundleVersion": "1", "KFBundlePackageType": "APP!"})
        (app / "app").write_text("#!/bin/sh\n")
        (app / "app").chmod(0o755)
        for plugin in plugins:
            bundle = app / "PlugIns" / f"{plugin}.appex"
            bundle.mkdir(parents=True)
            environment = {}
            if os.environ.get("ANNEXA_LIBRARY"):
                shutil.copytree(PACKAGE, bundle / "annexa", ignore=shutil.ignore_patterns("__pycache__"))
                shutil.copy(os.environ["ANNEXA_LIBRARY"], bundle / "libannexa.so.1")
                environment["ANNEXA_LIBRARY"] = str(bundle / "libannexa.so.1")
            write_plist(bundle / "Info.plist", {
                "KFBundleIdentifier": f"com.example.{name.lower()}.{plugin.lower()}",
                "KFBundleExecutable": "plugin", "KFBundleDisplayName": plugin,
                "KFBundleShortVersionString": "1.0", "KFBundleVersion": "1", "KFBundlePackageType": "RPX!",
                "RPXService": {"EnvironmentVariables": environment},
                "KSExtension": {"KSExtensionPointIdentifier": "com.example.greeting",
                                "KSExtensionAttributes": {"KSExtensionPointName": "Greeting", "Language": "en"}}})
            (bundle / "plugin").write_text(PLUGIN_SOURCE)
            (bundle / "plugin").chmod(0o755)
        self.tool("axctl", "add", str(app))
        return app


@pytest.fixture(scope="module")
def platform(tmp_path_factory: pytest.TempPathFactory) -> Iterator[Platform]:
    root = tmp_path_factory.mktemp("root")
    saved: Optional[str] = os.environ.get("CORVANE_ROOT")
    os.environ["CORVANE_ROOT"] = str(root)
    p = Platform(root)
    try:
        # axd needs its entitlements to register plug-ins with spawnd: a key of this root signs a
        # copy of it.
        p.tool("axsign", "keygen", "--out", str(root / "key"))
        p.tool("axsign", "trust", str(root / "key.pub"))
        (root / "bin").mkdir()
        axd = root / "bin" / "axd"
        shutil.copy(program("axd"), axd)
        write_plist(root / "axd-entitlements.plist", {
            "com.corvane.private.rpx.domain-extension.proxy": True, "com.corvane.private.pcx.manager": True})
        p.tool("axsign", "sign", "--key", str(root / "key"), "--entitlements", str(root / "axd-entitlements.plist"), str(axd))
        p.start([program("spawnd"), "--grace-ms", "500"], "com.corvane.spawnd", "spawnd.log")
        p.start([str(axd)], "com.corvane.annexa.axd", "axd.log")
        yield p
    finally:
        p.stop()
        if saved is None:
            os.environ.pop("CORVANE_ROOT", None)
        else:
            os.environ["CORVANE_ROOT"] = saved
