"""What the bluez4-sim tests and btbusctl's share: the launcher on private buses, and its D-Bus."""

import os
import pathlib
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
from dbus.mainloop.glib import DBusGMainLoop
from gi.repository import GLib

LAUNCHER = os.path.join(os.path.dirname(os.path.abspath(__file__)), '..', '..', 'tools', 'bluez4-sim', 'bluez4-sim')
CONTROL = ('/org/btbus/Simulator', 'org.btbus.Simulator')  # path and interface
ROUND_SECONDS = 0.3

DBusGMainLoop(set_as_default=True)
# Scratch files never go to /tmp: ctest points $TMPDIR into the build tree, a run by hand under the cwd.
if not os.environ.get('TMPDIR'):
    os.environ['TMPDIR'] = tempfile.tempdir = tempfile.mkdtemp(prefix='sim-test-', dir=os.getcwd())


class Launcher:
    """One running bluez4-sim launcher, once it said `ready`, and the addresses it exported."""

    def __init__(self, *extra_args, env=None):
        with tempfile.NamedTemporaryFile('w', suffix='.env', delete=False) as out:
            self.env_file = out.name
            self.proc = subprocess.Popen(
                [LAUNCHER, '--print-ready', '--round-seconds', str(ROUND_SECONDS), *extra_args],
                stdout=out, stderr=subprocess.PIPE, text=True, env=env)
        while (line := self.proc.stderr.readline()) != 'ready\n':
            if not line:
                raise RuntimeError(f'the launcher exited early ({self.proc.wait()})')
            sys.stderr.write(line)
        self.relay = threading.Thread(target=shutil.copyfileobj, args=(self.proc.stderr, sys.stderr))
        self.relay.start()
        with open(self.env_file, encoding='utf-8') as f:  # only export lines, for `.` to read
            lines = [re.fullmatch(r'export (DBUS_\w+_BUS_ADDRESS)=(.*)', line) for line in f.read().splitlines()]
        self.env = dict(match.groups() for match in lines)  # None has no groups: not an export line

    def stop(self):
        """SIGTERM, then its exit status (as well when called again)."""
        self.proc.send_signal(signal.SIGTERM)  # nothing, if it has ended
        try:
            return self.proc.wait(timeout=10)
        finally:
            self.relay.join(10)
            self.proc.stderr.close()
            pathlib.Path(self.env_file).unlink(missing_ok=True)  # stopped once before


def run_until(predicate, timeout=10.0):
    """Runs the GLib main loop until predicate() holds; False if it did not by the deadline."""
    context, deadline = GLib.MainContext.default(), time.monotonic() + timeout
    while not predicate():
        if time.monotonic() > deadline:
            return False
        context.iteration(False) or time.sleep(0.002)
    return True


class SimTestCase(unittest.TestCase):
    """A launcher (with extra_args) per module, its system bus and org.bluez's signals; Reset() per test."""

    extra_args = ()

    @classmethod
    def setUpClass(cls):
        cls.launcher = Launcher(*cls.extra_args)
        cls.bus = dbus.bus.BusConnection(cls.launcher.env['DBUS_SYSTEM_BUS_ADDRESS'])
        cls.signals = []  # (path, interface, member, [arguments])
        record = lambda *args, path, iface, member: cls.signals.append((path, iface, member, list(args)))  # noqa: E731
        cls.bus.add_signal_receiver(record, bus_name='org.bluez', path_keyword='path', interface_keyword='iface',
                                    member_keyword='member')

    @classmethod
    def tearDownClass(cls):
        cls.bus.close()
        cls.launcher.stop()

    def setUp(self):
        self.control('Reset')
        self.drain()
        del self.signals[:]
        self.adapter = self.call('/', 'org.bluez.Manager', 'DefaultAdapter')

    def call(self, path, iface, member, *args):
        return self.bus.call_blocking('org.bluez', path, iface, member, None, args)

    def control(self, member, *args):
        return self.call(*CONTROL, member, *args)

    def assert_error(self, error, path, iface, member, *args):
        """error: a D-Bus error's name, or (name, message)."""
        with self.assertRaises(dbus.DBusException) as raised:
            self.call(path, iface, member, *args)
        got = raised.exception.get_dbus_name(), raised.exception.get_dbus_message()
        self.assertEqual(got if isinstance(error, tuple) else got[0], error)

    def drain(self, seconds=0.05):
        """Lets queued signals arrive."""
        run_until(lambda: False, seconds)

    def wait_signal(self, member, path=None):
        """The arguments of the first such signal, once it has arrived."""
        found = lambda: [args for p, _i, m, args in self.signals if m == member and path in (None, p)]  # noqa: E731
        self.assertTrue(run_until(found), f'no {member} signal')
        return found()[0]

    def device_path(self, address):
        return f'{self.adapter}/dev_{address.replace(":", "_")}'
