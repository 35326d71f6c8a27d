"""A real vantreld on a private tree for the tests, with sample bundles.

VANTRELD names the daemon binary (default: build/dev/tools/vantreld in the
repository)."""

from __future__ import annotations

import os
import signal
import plistlib
import shutil
import socket
import subprocess
import sys
import tempfile
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
REPO = os.path.dirname(os.path.dirname(os.path.dirname(HERE)))
sys.path.insert(0, os.path.dirname(HERE))

VANTRELD = os.environ.get("VANTRELD") or os.path.join(REPO, "build/dev/tools/vantreld")
START_TIMEOUT = 10.0


def write_bundle(path: str, info: dict, executable: str = "") -> str:
    """A bundle directory with info as its Info.plist, and a copy of
    /bin/sleep as its executable when executable is given: a real binary, so
    that a process running it is seen to run inside the bundle."""
    os.makedirs(path, exist_ok=True)
    with open(os.path.join(path, "Info.plist"), "wb") as file:
        plistlib.dump(info, file)
    if executable:
        shutil.copy("/bin/sleep", os.path.join(path, executable))
    return path


def plugin_info(identifier: str, point: str = "com.example.share") -> dict:
    return {
        "KBBundleIdentifier": identifier,
        "KBBundleVersion": "1",
        "KBBundleExecutable": "plugin",
        "QXExtension": {"QXExtensionPointIdentifier": point, "QXExtensionAttributes": {}},
    }


def write_app(root: str, name: str, plugins: list) -> str:
    """root/<name>.app with one plug-in bundle per identifier in plugins."""
    app = write_bundle(os.path.join(root, f"{name}.app"), {
        "KBBundleIdentifier": f"com.example.{name.lower()}",
        "KBBundleExecutable": name,
    }, executable=name)
    for identifier in plugins:
        write_bundle(os.path.join(app, "PlugIns", identifier.rsplit(".", 1)[-1] + ".appex"),
                     plugin_info(identifier), executable="plugin")
    return app


class Daemon:
    """vantreld serving an absolute socket path; everything it reads or
    writes lies under one temporary directory."""

    def __init__(self) -> None:
        # World-readable so that a test may connect as another user.
        self.root = os.path.realpath(tempfile.mkdtemp(prefix="vantrel-py-"))
        os.chmod(self.root, 0o755)
        self.socket = os.path.join(self.root, "vantreld.sock")
        self.apps = os.path.join(self.root, "apps")
        self.log_path = os.path.join(self.root, "vantreld.log")
        self.process: subprocess.Popen | None = None
        self.env = {"PATH": os.environ.get("PATH", "/usr/bin:/bin"), "VANTREL_LOG": "stderr"}
        for entry in ["VANTREL_RUNTIME_DIR=run", "VANTREL_STATE_DIR=state", "VANTREL_APP_DIRS=apps",
                      "VANTREL_PLUGIN_DIRS=plugins", "VANTREL_SDK_DIRS=sdks",
                      "VANTREL_SYSTEM_DIR=system", "VANTREL_PREFERENCES_DIR=prefs",
                      "XDG_STATE_HOME=xdg-state", "XDG_CONFIG_HOME=xdg-config", "HOME=home"]:
            variable, directory = entry.split("=")
            self.env[variable] = os.path.join(self.root, directory)
            os.makedirs(self.env[variable], exist_ok=True)

    def start(self) -> None:
        if not os.access(VANTRELD, os.X_OK):
            raise RuntimeError(f"no vantreld at {VANTRELD}: build it, or set VANTRELD to its path")
        with open(self.log_path, "ab") as log:
            self.process = subprocess.Popen(
                [VANTRELD, "-S", self.socket, "-d", os.path.join(self.root, "Annotations")],
                env=self.env, stdin=subprocess.DEVNULL, stdout=log, stderr=log)
        deadline = time.monotonic() + START_TIMEOUT
        while time.monotonic() < deadline:
            if self.process.poll() is not None:
                raise RuntimeError(f"vantreld exited with {self.process.returncode}:\n{self.log()}")
            with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as probe:
                try:
                    probe.connect(self.socket)
                    return
                except OSError:
                    time.sleep(0.05)
        raise RuntimeError(f"vantreld did not listen on {self.socket}:\n{self.log()}")

    def signal(self, number: int) -> None:
        assert self.process is not None
        self.process.send_signal(number)

    def pause(self) -> None:
        """SIGSTOP, returning once every thread has stopped: the kernel
        wakes one thread to stop the others, and on a busy machine another
        could still answer a request sent meanwhile."""
        assert self.process is not None
        self.process.send_signal(signal.SIGSTOP)
        tasks = f"/proc/{self.process.pid}/task"
        deadline = time.monotonic() + START_TIMEOUT
        while time.monotonic() < deadline:
            states = []
            for task in os.listdir(tasks):
                try:
                    with open(os.path.join(tasks, task, "stat")) as stat:
                        states.append(stat.read().rsplit(")", 1)[1].split()[0])
                except OSError:
                    pass  # a thread that has just ended
            if states and all(state in ("T", "t") for state in states):
                return
            time.sleep(0.005)
        raise RuntimeError("vantreld did not stop")

    def resume(self) -> None:
        self.signal(signal.SIGCONT)

    def remove(self) -> None:
        if self.process is not None and self.process.poll() is None:
            self.process.kill()
            self.process.wait()
        shutil.rmtree(self.root, ignore_errors=True)

    def log(self) -> str:
        with open(self.log_path, encoding="utf-8", errors="replace") as log:
            return log.read()


class DaemonTestCase(unittest.TestCase):
    """Starts one daemon for the class, with Notes.app (two plug-ins) in its
    application directory."""

    daemon: Daemon
    notes: str

    @classmethod
    def setUpClass(cls) -> None:
        cls.daemon = Daemon()
        cls.addClassCleanup(cls.daemon.remove)
        cls.notes = write_app(cls.daemon.apps, "Notes",
                              ["com.example.notes.share", "com.example.notes.print"])
        cls.daemon.start()
