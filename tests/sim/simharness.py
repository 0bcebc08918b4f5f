"""Shared helpers for the bluez4-sim tests: start the launcher, talk to it over D-Bus.

Every test module starts one launcher with private buses (SimTestCase) and
calls the control interface's Reset() before each test.
"""

import os
import re
import shutil
import signal
import subprocess
import sys
import tempfile
import threading
import time
import unittest

import dbus
import dbus.bus
import dbus.service
from dbus.mainloop.glib import DBusGMainLoop
from gi.repository import GLib

HERE = os.path.dirname(os.path.abspath(__file__))
LAUNCHER = os.environ.get('BLUEZ4_SIM') or os.path.normpath(
    os.path.join(HERE, '..', '..', 'tools', 'bluez4-sim', 'bluez4-sim'))
PYTHON = '/usr/bin/python3'
CONTROL_PATH = '/org/btbus/Simulator'
CONTROL_IFACE = 'org.btbus.Simulator'
ROUND_SECONDS = 0.3

DBusGMainLoop(set_as_default=True)


def scratch_dir():
    """$TMPDIR (ctest points it into the build tree), else a fresh dir under the cwd."""
    if not os.environ.get('TMPDIR'):
        base = os.path.join(os.getcwd(), 'sim-test-tmp')
        os.makedirs(base, exist_ok=True)
        os.environ['TMPDIR'] = tempfile.mkdtemp(dir=base)
        tempfile.tempdir = None
    return os.environ['TMPDIR']


def children_of(pid):
    """PIDs whose parent is `pid` (from /proc)."""
    found = []
    for entry in os.listdir('/proc'):
        if entry.isdigit():
            try:
                with open(f'/proc/{entry}/stat', encoding='utf-8') as f:
                    stat = f.read()
            except OSError:
                continue
            if int(stat.rsplit(')', 1)[1].split()[1]) == pid:
                found.append(int(entry))
    return found


def alive(pid):
    """True if `pid` exists and is not a zombie."""
    try:
        with open(f'/proc/{pid}/stat', encoding='utf-8') as f:
            return f.read().rsplit(')', 1)[1].split()[0] != 'Z'
    except OSError:
        return False


class Launcher:
    """One running bluez4-sim launcher and the environment it printed."""

    def __init__(self, *extra_args, env=None):
        scratch_dir()
        started = time.monotonic()
        with tempfile.NamedTemporaryFile('w', suffix='.env', delete=False) as out:
            self.env_file = out.name
            self.proc = subprocess.Popen(
                [LAUNCHER, '--print-ready', '--round-seconds', str(ROUND_SECONDS), *extra_args],
                stdout=out, stderr=subprocess.PIPE, text=True, env=env)
        for line in self.proc.stderr:
            if line.strip() == 'ready':
                break
            sys.stderr.write(line)
        else:
            raise RuntimeError(f'launcher exited early ({self.proc.wait()})')
        self.relay = threading.Thread(target=shutil.copyfileobj, args=(self.proc.stderr, sys.stderr))
        self.relay.start()
        self.env = {}
        with open(self.env_file, encoding='utf-8') as f:
            for line in f:  # the file must stay something that `.` can read
                match = re.fullmatch(r'export (DBUS_\w+_BUS_ADDRESS)=(.*)', line.strip())
                if not match:
                    raise RuntimeError(f'not an export line on stdout: {line!r}')
                self.env[match.group(1)] = match.group(2)
        self.startup_seconds = time.monotonic() - started

    def stop(self):
        """SIGTERM, then wait; returns the exit status."""
        if self.proc.poll() is None:
            self.proc.send_signal(signal.SIGTERM)
        try:
            return self.proc.wait(timeout=10)
        finally:
            self.relay.join(10)
            self.proc.stderr.close()
            os.unlink(self.env_file)


def run_until(predicate, timeout=5.0):
    """Run the GLib main loop until predicate() is true; False on timeout."""
    context = GLib.MainContext.default()
    deadline = time.monotonic() + timeout
    while not predicate():
        if time.monotonic() > deadline:
            return False
        context.iteration(False) or time.sleep(0.002)
    return True


class AsyncCall:
    """A method call whose answer arrives while the main loop runs (agents can answer meanwhile)."""

    def __init__(self, bus, path, iface, member, signature='', args=()):
        self.result = self.error = None
        self.done = False
        bus.call_async('org.bluez', path, iface, member, signature, args,
                       self._ok, self._err, timeout=30)

    def _ok(self, *values):
        self.result, self.done = (values[0] if values else None), True

    def _err(self, error):
        self.error, self.done = error, True

    def wait(self, timeout=10.0):
        if not run_until(lambda: self.done, timeout):
            raise AssertionError('no answer')
        return self


class TestAgent(dbus.service.Object):
    """A BlueZ agent exported by the test; answers come from `answers` (callables or values).

    An answer of None for a request makes the agent sit on it (never replies).
    """

    IFACE = 'org.bluez.Agent'

    def __init__(self, bus, path, answers=None):
        super().__init__(bus, path)
        self.path = path
        self.answers = answers or {}
        self.calls = []

    def _answer(self, member, args, ok, err):
        self.calls.append((member, *args))
        answer = self.answers.get(member, '')
        if answer is None:
            return
        if isinstance(answer, Exception):
            err(answer)
        elif answer == '':
            ok()
        else:
            ok(answer)

    @dbus.service.method(IFACE, in_signature='', out_signature='')
    def Release(self):
        self.calls.append(('Release',))

    @dbus.service.method(IFACE, in_signature='', out_signature='')
    def Cancel(self):
        self.calls.append(('Cancel',))

    @dbus.service.method(IFACE, in_signature='o', out_signature='s', async_callbacks=('ok', 'err'))
    def RequestPinCode(self, device, ok, err):
        self._answer('RequestPinCode', [device], ok, err)

    @dbus.service.method(IFACE, in_signature='o', out_signature='u', async_callbacks=('ok', 'err'))
    def RequestPasskey(self, device, ok, err):
        self._answer('RequestPasskey', [device], ok, err)

    @dbus.service.method(IFACE, in_signature='ou', out_signature='', async_callbacks=('ok', 'err'))
    def RequestConfirmation(self, device, passkey, ok, err):
        self._answer('RequestConfirmation', [device, passkey], ok, err)

    @dbus.service.method(IFACE, in_signature='ou', out_signature='')
    def DisplayPasskey(self, device, passkey):
        self.calls.append(('DisplayPasskey', device, passkey))

    @dbus.service.method(IFACE, in_signature='os', out_signature='', async_callbacks=('ok', 'err'))
    def Authorize(self, device, uuid, ok, err):
        self._answer('Authorize', [device, uuid], ok, err)

    def members(self):
        return [c[0] for c in self.calls]


def rejected():
    return dbus.DBusException('no', name='org.bluez.Error.Rejected')


class SimTestCase(unittest.TestCase):
    """Starts one launcher per test module; Reset() and a fresh signal record per test."""

    launcher = None
    extra_args = ()

    @classmethod
    def setUpClass(cls):
        cls.launcher = Launcher(*cls.extra_args)
        cls.bus = dbus.bus.BusConnection(cls.launcher.env['DBUS_SYSTEM_BUS_ADDRESS'])
        cls.bus.add_signal_receiver(cls._record, bus_name='org.bluez', path_keyword='path',
                                    interface_keyword='iface', member_keyword='member')
        cls.signals = []

    @classmethod
    def tearDownClass(cls):
        cls.bus.close()
        cls.launcher.stop()

    @classmethod
    def _record(cls, *args, path=None, iface=None, member=None):
        cls.signals.append((str(path), str(iface), str(member), list(args)))

    def setUp(self):
        self.control('Reset')
        self.drain()
        del self.signals[:]
        self.adapter = self.call('/', 'org.bluez.Manager', 'DefaultAdapter')
        self.control('ClearCallLog')

    def control(self, member, *args):
        return self.bus.call_blocking('org.bluez', CONTROL_PATH, CONTROL_IFACE, member,
                                      None, args)

    def call(self, path, iface, member, *args, signature=None):
        return self.bus.call_blocking('org.bluez', path, iface, member, signature, args)

    def assert_error(self, name, path, iface, member, *args, signature=None):
        with self.assertRaises(dbus.DBusException) as ctx:
            self.call(path, iface, member, *args, signature=signature)
        self.assertEqual(ctx.exception.get_dbus_name(), name)
        return ctx.exception

    def drain(self, seconds=0.05):
        """Let queued signals arrive."""
        end = time.monotonic() + seconds
        run_until(lambda: time.monotonic() > end, seconds + 1)

    def wait_signal(self, member, path=None, timeout=5.0, **_):
        """Wait for a signal; returns its index in self.signals."""
        def index():
            for i, (p, _iface, m, _args) in enumerate(self.signals):
                if m == member and (path is None or p == path):
                    return i
            return None
        if not run_until(lambda: index() is not None, timeout):
            self.fail(f'no {member} signal')
        return index()

    def device_path(self, address):
        return f'{self.adapter}/dev_{address.replace(":", "_")}'
