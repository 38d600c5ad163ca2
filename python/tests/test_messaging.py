"""The post-office client against a real lumaserver, in a child process with
a private runtime directory and registry hive."""
import numpy as np
import pytest

import nxbase
from conftest import CHART, run_python


def test_client_measures_the_chart_through_lumaserver(sandbox):
    out = run_python(
        "import nxbase, numpy as np\n"
        "with nxbase.Client('pytest') as client:\n"
        "    status, data = client.send('LumaServer', 'GET_DEVICE_NAME')\n"
        "    print(status, nxbase.unpack(data, 'str')[0])\n"
        "    ids, spectra = client.measure(3)\n"
        "    print(','.join(ids))\n"
        "    np.save('" + sandbox["NXBASE_LOG_PATH"] + "/spectra.npy', spectra)\n",
        sandbox)
    lines = out.splitlines()
    assert lines[0].startswith("0 ") and len(lines[0]) > 2
    assert lines[1].count(",") == 2
    measured = np.load(sandbox["NXBASE_LOG_PATH"] + "/spectra.npy")
    assert measured.shape == (3, 36) and measured.dtype == np.float32
    _, _, chart = nxbase.read_spectra(CHART)
    # The server sends integers of 1/100000.
    np.testing.assert_allclose(measured, chart[:3], atol=6e-6)


def test_client_errors_are_exceptions(sandbox):
    out = run_python(
        "import nxbase\n"
        "client = nxbase.Client('pytest')\n"
        "for call in (lambda: client.send('LumaServer', 'NO_SUCH_MESSAGE'),\n"
        "             lambda: client.send('LumaServer', 'GET_DEVICE_NAME', [('b', 300)]),\n"
        "             lambda: client.send('LumaServer', 'GET_DEVICE_NAME', [object()]),\n"
        "             lambda: client.measure(0)):\n"
        "    try:\n"
        "        call()\n"
        "    except (ValueError, TypeError) as error:\n"
        "        print(type(error).__name__)\n"
        "try:\n"
        "    client.send('NobodyHere', 'GET_DEVICE_NAME', timeout=1)\n"
        "except RuntimeError as error:\n"
        "    print('RuntimeError')\n"
        "client.close()\n"
        "try:\n"
        "    client.send('LumaServer', 'GET_DEVICE_NAME')\n"
        "except RuntimeError as error:\n"
        "    print('closed')\n",
        sandbox)
    assert out.split() == ["ValueError", "ValueError", "TypeError", "ValueError", "RuntimeError", "closed"]


def test_unpack_reads_typed_values_and_refuses_short_data():
    assert nxbase.unpack(b"\x05\x01\x00\x02\x00\x00\x00abc\x00", "b,s,i,str") == [5, 1, 2, "abc"]
    with pytest.raises(ValueError, match="ends before"):
        nxbase.unpack(b"\x01", "i")


def test_ctrl_c_ends_a_wait_cleanly(sandbox, tmp_path):
    # A registered peer that starts but never answers.
    silent = tmp_path / "Silent"
    pid_file = tmp_path / "silent.pid"
    silent.write_text(f"#!/bin/sh\necho $$ > {pid_file}\nexec sleep 20 </dev/null >/dev/null 2>&1\n")
    silent.chmod(0o755)
    import subprocess
    from conftest import tool
    subprocess.run([tool("nxreg"), "set", "HKLM\\Software\\K-Lume\\ChromaLink\\Applications", "Silent",
                    str(silent)], env=sandbox, check=True, timeout=30)
    out = run_python(
        "import nxbase, os, signal, threading, time\n"
        "client = nxbase.Client('pytest')\n"
        "threading.Timer(1.0, lambda: os.kill(os.getpid(), signal.SIGINT)).start()\n"
        "start = time.monotonic()\n"
        "try:\n"
        "    client.send('Silent', 'GET_DEVICE_NAME', timeout=15)\n"
        "    print('answered')\n"
        "except KeyboardInterrupt:\n"
        "    print('interrupted', time.monotonic() - start < 5)\n"
        "except RuntimeError as error:\n"
        "    print('failed', error)\n",
        sandbox)
    if pid_file.exists():
        import os
        import signal
        try:
            os.kill(int(pid_file.read_text()), signal.SIGKILL)
        except ProcessLookupError:
            pass
    assert out.split() == ["interrupted", "True"], out


def test_one_client_per_process_and_close_from_another_thread(sandbox):
    out = run_python(
        "import nxbase, os, signal, threading, time\n"
        "client = nxbase.Client('pytest')\n"
        "try:\n"
        "    nxbase.Client('second')\n"
        "except RuntimeError as error:\n"
        "    print('second refused:', 'open already' in str(error))\n"
        "client.send('LumaServer', 'CONNECT', [('b', 2)])\n"
        "def ours(pid):\n"
        "    try:\n"
        "        with open(f'/proc/{pid}/comm') as comm, open(f'/proc/{pid}/environ', 'rb') as env:\n"
        "            return comm.read().strip() == 'lumaserver' and os.environ['NXBASE_RUNTIME_DIR'].encode() in env.read()\n"
        "    except OSError:\n"
        "        return False\n"
        "server = next(int(p) for p in os.listdir('/proc') if p.isdigit() and ours(p))\n"
        "os.kill(server, signal.SIGSTOP)\n"
        "closer = threading.Thread(target=lambda: (time.sleep(0.3), client.close()))\n"
        "closer.start()\n"
        "start = time.monotonic()\n"
        "try:\n"
        "    client.send('LumaServer', 'GET_DEVICE_NAME', timeout=10)\n"
        "except RuntimeError as error:\n"
        "    print('closed:', time.monotonic() - start < 2, 'closed while it waited' in str(error))\n"
        "closer.join(5)\n"
        "os.kill(server, signal.SIGKILL)\n"
        "nxbase.Client('again').close()\n"
        "print('again: True')\n",
        sandbox)
    assert out.splitlines() == ["second refused: True", "closed: True True", "again: True"]


def test_a_forked_child_that_exits_leaves_the_parents_client_alone(sandbox):
    out = run_python(
        "import nxbase, os, sys\n"
        "client = nxbase.Client('pytest')\n"
        "print(client.send('LumaServer', 'CONNECT', [('b', 2)])[0])\n"
        "socket = os.path.join(os.environ['NXBASE_RUNTIME_DIR'], 'PipeRequest-pytest')\n"
        "child = os.fork()\n"
        "if child == 0:\n"
        "    client.close()\n"
        "    os._exit(0)\n"
        "os.waitpid(child, 0)\n"
        "child = os.fork()\n"
        "if child == 0:\n"
        "    sys.exit(0)\n"
        "os.waitpid(child, 0)\n"
        "print(os.path.exists(socket), client.send('LumaServer', 'GET_DEVICE_NAME')[0])\n"
        "client.post('LumaServer', 'DISCONNECT')\n",
        sandbox)
    assert out.splitlines() == ["2", "True 0"]
