"""Shared fixtures: the built module, the chart, a private messaging sandbox."""
import os
import shutil
import subprocess
import sys
import tempfile

import pytest

BIN_DIR = os.environ.get("NXBASE_BIN_DIR", "")
CHART = os.environ.get("NXBASE_CHART", "")


def tool(name):
    path = os.path.join(BIN_DIR, name)
    if not os.access(path, os.X_OK):
        pytest.skip(f"{name} not built")
    return path


@pytest.fixture
def sandbox():
    """A private runtime directory, registry hives and log directory, with
    LumaServer registered; no session bus. Removed afterwards."""
    root = tempfile.mkdtemp(prefix="nxbase-py-")
    env = dict(os.environ)
    env.update(
        NXBASE_RUNTIME_DIR=os.path.join(root, "run"),
        NXBASE_MACHINE_REGISTRY=os.path.join(root, "machine.sqlite"),
        NXBASE_USER_REGISTRY=os.path.join(root, "user.sqlite"),
        NXBASE_LOG_PATH=os.path.join(root, "log"),
        NXBASE_WAIT_TIMEOUT="20",
        DBUS_SESSION_BUS_ADDRESS="",
        XDG_RUNTIME_DIR="",
        USERNAME="",
    )
    os.makedirs(env["NXBASE_RUNTIME_DIR"], mode=0o700)
    os.makedirs(env["NXBASE_LOG_PATH"], mode=0o700)
    subprocess.run([tool("lumaserver"), "--register"], env=env, check=True,
                   stdout=subprocess.DEVNULL, timeout=30)
    yield env
    shutil.rmtree(root, ignore_errors=True)


def run_python(code, env, timeout=60):
    """Runs `code` in a child interpreter. The child's output pipes are
    inherited by a server it starts, so waiting for their end also waits
    for that server to finish."""
    result = subprocess.run([sys.executable, "-c", code], env=env, capture_output=True,
                            text=True, timeout=timeout)
    assert result.returncode == 0, result.stderr
    return result.stdout
