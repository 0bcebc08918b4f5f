"""The launcher's process handling, and the template run directly by dbusmock."""

import os
import shutil
import signal
import subprocess
import tempfile
import time
import unittest

import dbus
import dbus.bus

from simharness import PYTHON, LAUNCHER, Launcher, alive, children_of

TEMPLATE = os.path.join(os.path.dirname(LAUNCHER), 'bluez4.py')
# Notes the system bus it was given, takes its name, and stays until killed.
ACTIVATED_SERVICE = '''import os, sys, time, dbus.bus
with open(sys.argv[1], 'w') as f:
    f.write(os.environ.get('DBUS_SYSTEM_BUS_ADDRESS', ''))
bus = dbus.bus.BusConnection(os.environ['DBUS_SESSION_BUS_ADDRESS'])
bus.set_exit_on_disconnect(False)
bus.request_name('org.btbus.Activated')
while True:
    time.sleep(60)
'''


def wait_for_bluez(address, proc, timeout=10):
    bus = dbus.bus.BusConnection(address)
    deadline = time.monotonic() + timeout
    while not bus.name_has_owner('org.bluez'):
        if proc.poll() is not None or time.monotonic() > deadline:
            raise AssertionError('org.bluez did not appear')
        time.sleep(0.02)
    return bus


def command_of(pid):
    with open(f'/proc/{pid}/cmdline', 'rb') as f:
        return f.read().split(b'\0')[0].decode()


class LauncherTest(unittest.TestCase):

    def test_sigterm_stops_everything_it_started(self):
        launcher = Launcher()
        sourced = subprocess.run(['sh', '-c', '. "$1" && echo "$DBUS_SYSTEM_BUS_ADDRESS"', 'sh', launcher.env_file],
                                 capture_output=True, text=True, timeout=10, check=True)
        self.assertEqual(sourced.stdout.strip(), launcher.env['DBUS_SYSTEM_BUS_ADDRESS'])
        children = children_of(launcher.proc.pid)
        self.assertEqual(sorted(os.path.basename(command_of(pid)) for pid in children),
                         ['dbus-daemon', 'dbus-daemon', 'python3'])
        self.assertEqual(launcher.stop(), 0)
        self.assertEqual([pid for pid in children if alive(pid)], [])

    def test_sigint_too_and_env_buses_and_plain_dbusmock(self):
        """A second simulator on the first one's session bus, via --use-env-buses and via dbusmock."""
        host = Launcher()
        try:
            env = dict(os.environ, DBUS_SYSTEM_BUS_ADDRESS=host.env['DBUS_SESSION_BUS_ADDRESS'])
            guest = Launcher('--use-env-buses', env=env)
            self.assertEqual(guest.env, {})
            bus = dbus.bus.BusConnection(host.env['DBUS_SESSION_BUS_ADDRESS'])
            path = bus.call_blocking('org.bluez', '/', 'org.bluez.Manager', 'DefaultAdapter', '', ())
            self.assertEqual(path, f'/org/bluez/{children_of(guest.proc.pid)[0]}/hci0')
            bus.close()
            guest.proc.send_signal(signal.SIGINT)
            self.assertEqual(guest.stop(), 0)

            mock = subprocess.Popen([PYTHON, '-m', 'dbusmock', '--system', '--template', TEMPLATE],
                                    env=env, stdout=subprocess.DEVNULL)
            try:
                bus = wait_for_bluez(host.env['DBUS_SESSION_BUS_ADDRESS'], mock)
                path = bus.call_blocking('org.bluez', '/', 'org.bluez.Manager', 'DefaultAdapter', '', ())
                self.assertEqual(path, f'/org/bluez/{mock.pid}/hci0')
                bus.close()
            finally:
                mock.terminate()
                mock.wait(10)
        finally:
            host.stop()

    def test_activated_services_see_the_private_buses_and_stop_with_the_launcher(self):
        services = tempfile.mkdtemp()
        self.addCleanup(shutil.rmtree, services)
        seen = os.path.join(services, 'seen')
        with open(os.path.join(services, 'service.py'), 'w', encoding='utf-8') as f:
            f.write(ACTIVATED_SERVICE)
        with open(os.path.join(services, 'org.btbus.Activated.service'), 'w', encoding='utf-8') as f:
            f.write(f'[D-BUS Service]\nName=org.btbus.Activated\nExec={PYTHON} {services}/service.py {seen}\n')
        launcher = Launcher('--service-dir', services)
        try:
            bus = dbus.bus.BusConnection(launcher.env['DBUS_SESSION_BUS_ADDRESS'])
            bus.start_service_by_name('org.btbus.Activated')
            pid = int(bus.call_blocking('org.freedesktop.DBus', '/org/freedesktop/DBus', 'org.freedesktop.DBus',
                                        'GetConnectionUnixProcessID', 's', ['org.btbus.Activated']))
            bus.close()
            with open(seen, encoding='utf-8') as f:
                self.assertEqual(f.read(), launcher.env['DBUS_SYSTEM_BUS_ADDRESS'])
            self.assertTrue(alive(pid))
        finally:
            self.assertEqual(launcher.stop(), 0)
        self.assertFalse(alive(pid))

    def test_missing_scene_is_reported(self):
        out = subprocess.run([LAUNCHER, '--scene', 'no-such-scene.json'], capture_output=True, text=True,
                             timeout=20)
        self.assertEqual(out.returncode, 2)
        self.assertIn('cannot load scene', out.stderr)


if __name__ == '__main__':
    unittest.main()
