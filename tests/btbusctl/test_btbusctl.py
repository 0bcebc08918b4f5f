"""btbusctl end to end: every command against bluez4-sim on private buses.

The commands run as a user's shell would run them; --json output is parsed.
"""

import json
import os
import signal
import subprocess
import tempfile
import threading
import unittest

import dbus

from simharness import SimTestCase, run_until

# Through the emulator that runs the target's programs, in a cross-built run.
BTBUSCTL = [*os.environ.get('BTBUS_TEST_EMULATOR', '').split(), os.environ['BTBUSCTL']]
IN_PRIVATE_MOUNTS = os.path.join(os.path.dirname(__file__), '..', '..', 'scripts', 'in-private-mounts.sh')
# Runs the commands of argv[1] (JSON) and prints their [status, stdout, stderr] as JSON.
RUNNER = ('import json, subprocess, sys\n'
          'done = [subprocess.run(c, capture_output=True, text=True) for c in json.loads(sys.argv[1])]\n'
          'print(json.dumps([[d.returncode, d.stdout, d.stderr] for d in done]))')
ADAPTER = 'org.bluez.Adapter'
HEADSET, KEYBOARD, PHONE, MOUSE = '00:0D:3C:A1:B2:C3', '00:12:A1:B0:00:42', '5C:F3:70:61:A0:17', '00:1F:20:AB:CD:EF'


class BtbusctlTest(SimTestCase):

    extra_args = ('--service-dir', os.environ['BTBUS_SERVICE_DIR'])  # the scanner service

    def btbusctl(self, *args, env=None):
        done = subprocess.run([*BTBUSCTL, *args], env=env or self.launcher.env, capture_output=True,
                              text=True, timeout=30)
        return done.returncode, done.stdout, done.stderr

    def start(self, *args):
        proc = subprocess.Popen([*BTBUSCTL, '--json', *args], env=self.launcher.env, stdout=subprocess.PIPE,
                                text=True)
        self.addCleanup(self.stop, proc)
        return proc

    @staticmethod
    def stop(proc):
        if proc.poll() is None:  # the test failed before it stopped it
            proc.kill()
        proc.wait(10)
        proc.stdout.close()

    def property(self, name):
        return self.call(self.adapter, ADAPTER, 'GetProperties')[name]

    def check(self, cases, run):
        """Cases are (arguments, exit status, check of the parsed output or a text of stderr);
        run gives the results of all their arguments, in order."""
        for (args, status, check), (code, out, err) in zip(cases, run([args for args, _, _ in cases])):
            with self.subTest(args=args):
                self.assertEqual(code, status, err)
                if callable(check):
                    check(json.loads(out) if args[0] == '--json' else out)
                else:
                    self.assertEqual(out, '')
                    self.assertIn(check, err)

    def test_one_shot_commands(self):
        """Run in order, each with --json."""
        cases = [
            (['adapters'], 0, lambda out: self.assertEqual(
                [(a['adapter'], a['address'], a['powered'], a['default']) for a in out],
                [('hci0', '00:1A:7D:DA:71:13', True, True)])),
            (['show', 'hci0'], 0, lambda out: (self.assertIn('HCIVersion', out),
                                               self.assertEqual(out['Name'], self.property('Name')))),
            (['set', 'hci0', 'Powered', 'off'], 0, lambda out: (self.assertIs(out['value'], False),
                                                              self.assertFalse(self.property('Powered')))),
            (['set', 'hci0', 'Pairable', 'yes'], 1, 'did not apply Pairable'),
            (['scan'], 1, 'the adapter is off'),
            (['set', 'hci0', 'Powered', 'on'], 0, lambda out: self.assertTrue(self.property('Powered'))),
            (['set', 'hci0', 'DiscoverableTimeout', '30'], 0, lambda _: self.assertEqual(
                self.property('DiscoverableTimeout'), 30)),
            (['-a', '00:1A:7D:DA:71:13', 'set', 'hci0', 'Name', 'front desk'], 0,
             lambda _: self.assertEqual(self.property('Name'), 'front desk')),
            (['-a', 'hci7', 'devices'], 1, 'No such adapter'),
            (['devices'], 0, lambda out: self.assertEqual([(d['Address'], d['Paired']) for d in out],
                                                          [(MOUSE, True)])),
            (['info', MOUSE], 0, lambda out: self.assertEqual(out['Path'], self.device_path(MOUSE))),
            (['info', HEADSET], 1, 'Does Not Exist'),
            (['services', HEADSET], 1, 'Does Not Exist'),
            (['audio', 'connect', HEADSET], 1, 'Does Not Exist'),
            (['create', HEADSET], 0, lambda out: self.assertEqual(out['path'], self.device_path(HEADSET))),
            (['services', HEADSET, '0x110b'], 0, lambda out: self.assertEqual(len(out['records']), 1)),
            (['volume', 'up', HEADSET], 1, 'not connected'),
            (['audio', 'connect', HEADSET], 0, lambda out: self.assertEqual(out['state'], 'connected')),
            (['audio', 'status', HEADSET], 0, lambda out: self.assertEqual((out['sink'], out['control']),
                                                                           (True, True))),
            (['volume', 'down', HEADSET], 0, lambda _: self.assertIn(
                f'{self.device_path(HEADSET)} org.bluez.Control.VolumeDown()', self.control('GetCallLog'))),
            (['audio', 'disconnect', HEADSET], 0, lambda out: self.assertEqual(out['state'], 'disconnected')),
            (['audio', 'status', MOUSE], 1, "doesn't exist"),
            (['pair', KEYBOARD, '--pin', '1234'], 1, 'Authentication Failed'),
            (['pair', KEYBOARD, '--pin', '0000'], 0, lambda out: self.assertEqual(
                [(r['request'], r['device'], r['answer']) for r in out['requests']][0],
                ('RequestPinCode', KEYBOARD, '0000'))),
            (['pair', PHONE, '--reject'], 1, 'Authentication Failed'),
            (['pair', PHONE, '--capability', 'KeyboardOnly', '--passkey', '482913'], 0,
             lambda out: self.assertEqual(out['requests'][0]['request'], 'RequestPasskey')),
            (['remove', MOUSE], 0, lambda _: self.assertNotIn(self.device_path(MOUSE),
                                                              self.property('Devices'))),
            (['remove', MOUSE], 1, 'Does Not Exist'),
            # Usage errors.
            ([], 2, 'A subcommand is required'),
            (['frobnicate'], 2, 'unknown command frobnicate'),
            (['devices', '--frobnicate'], 2, '--frobnicate'),
            (['info'], 2, 'address is required'),
            (['set', 'hci0', 'Address', '00:11:22:33:44:55'], 2, 'unknown property Address'),
            (['set', 'hci0', 'Powered', 'maybe'], 2, 'true or false'),
            (['set', 'hci0', 'PairableTimeout', '-1'], 2, 'number of seconds'),
            (['audio', 'play', HEADSET], 2, 'play not in'),
            (['pair', KEYBOARD, '--passkey', 'abc'], 2, '--passkey'),
            (['pair', KEYBOARD, '--capability', 'Telepathy'], 2, 'Telepathy'),
            (['scan', '--timeout', '-3'], 2, '--timeout'),
            (['autoconnect', 'add'], 2, 'needs an address'),
            (['autoconnect', 'reload', HEADSET], 2, 'takes no address'),
            (['name', HEADSET, '--wait', 'forever'], 2, 'forever not in'),
            (['name', HEADSET, '--wait', 'short'], 1, 'over HCI'),
        ]
        self.check([(['--json', *args], status, check) for args, status, check in cases],
                   lambda commands: (self.btbusctl(*args) for args in commands))  # each checked before the next

    def test_autoconnect_and_restart_in_private_mounts(self):
        if os.geteuid() != 0 or subprocess.run(['unshare', '-m', 'true'], capture_output=True).returncode:
            self.skipTest("needs root and 'unshare -m' to keep /etc and /tmp private")
        file = '/etc/bluetooth/autoconnect/00:1A:7D:DA:71:13'
        cases = [(['--json', 'autoconnect', 'show'], 0, lambda out: self.assertEqual(
                      (out['enabled'], out['devices'], out['file']), (False, [], file))),
                 (['--json', 'autoconnect', 'add', MOUSE.lower()], 0,
                  lambda out: self.assertEqual(out['devices'], [MOUSE])),
                 (['autoconnect', 'add', HEADSET], 1, 'Does Not Exist'),
                 (['--json', 'autoconnect', 'enable'], 0, lambda out: self.assertTrue(out['enabled'])),
                 (['cat', file], 0, lambda out: self.assertEqual(out, '1,' + MOUSE)),
                 (['autoconnect', 'pause'], 1, 'no auto-connect daemon reads /tmp/quill_bluetooth_autoconnect'),
                 (['--json', 'autoconnect', 'remove', MOUSE], 0, lambda out: self.assertEqual(
                     (out['enabled'], out['devices']), (True, []))),
                 (['restart-daemon'], 1, 'no adapter is attached')]
        scratch = tempfile.mkdtemp()
        self.addCleanup(os.rmdir, scratch)

        def in_private_mounts(commands):
            commands = [c if c[0] == 'cat' else [*BTBUSCTL, *c] for c in commands]
            out = subprocess.run([IN_PRIVATE_MOUNTS, scratch, '/usr/bin/python3', '-c', RUNNER, json.dumps(commands)],
                                 env=self.launcher.env, capture_output=True, text=True, timeout=60, check=True).stdout
            return json.loads(out)
        self.check(cases, in_private_mounts)
        self.assertFalse(os.path.exists(file))

    def test_human_output_help_version_and_a_missing_daemon(self):
        session = dict(self.launcher.env, DBUS_SYSTEM_BUS_ADDRESS=self.launcher.env['DBUS_SESSION_BUS_ADDRESS'])
        nowhere = dict(self.launcher.env, DBUS_SYSTEM_BUS_ADDRESS='unix:path=/nonexistent/btbus-test')
        cases = [(['adapters'], None, 0, 'hci0  00:1A:7D:DA:71:13  powered'),
                 (['info', MOUSE], None, 0, 'Paired: yes'),
                 (['--help'], None, 0, 'watch'),
                 (['pair', '--help'], None, 0, '--capability'),
                 (['--version'], None, 0, 'btbusctl '),
                 (['devices'], session, 1, 'btbusctl: bluetoothd is not running on the system bus'),
                 (['--json', 'adapters'], nowhere, 1, 'btbusctl: cannot reach the system bus')]
        for args, env, status, text in cases:
            with self.subTest(args=args):
                code, out, err = self.btbusctl(*args, env=env)
                self.assertEqual(code, status, err)
                self.assertIn(text, out if status == 0 else err)

    def test_scan_reports_devices_found_and_gone(self):
        scan = self.start('scan', '--timeout', '3')
        events = []
        for line in scan.stdout:
            events.append(json.loads(line))
            if (events[-1]['event'], events[-1].get('address')) == ('found', PHONE):
                self.control('SetInRange', 'hci0', PHONE, False)
        self.assertEqual(scan.wait(10), 0)
        found = sorted(e['address'] for e in events if e['event'] == 'found')
        self.assertEqual(found, sorted([HEADSET, KEYBOARD, PHONE, MOUSE]))
        self.assertEqual([e['address'] for e in events if e['event'] == 'disappeared'], [PHONE])
        self.assertFalse(self.property('Discovering'))

    def test_shared_scan_reads_the_scanner_service(self):
        scan = self.start('scan', '--shared', '--timeout', '3')
        events = [json.loads(line) for line in scan.stdout]
        self.assertEqual(scan.wait(10), 0)
        # The mouse is not among them: bluetoothd holds it as a device object.
        self.assertEqual(sorted(e['address'] for e in events if e['event'] == 'found'),
                         sorted([HEADSET, KEYBOARD, PHONE]))
        code, _, err = self.btbusctl('scan', '--shared', env={
            'DBUS_SYSTEM_BUS_ADDRESS': self.launcher.env['DBUS_SYSTEM_BUS_ADDRESS']})
        self.assertEqual((code, err), (1, 'btbusctl: the scanner service lives on the session bus, and '
                                          'DBUS_SESSION_BUS_ADDRESS is not set\n'))

    def test_watch_and_agent_report_each_event_once_until_interrupted(self):
        watch = self.start('watch')
        self.assertEqual(json.loads(watch.stdout.readline())['event'], 'watching')
        agent = self.start('agent', '--pin', '0000')
        self.assertEqual(json.loads(agent.stdout.readline())['event'], 'registered')
        self.assertEqual(self.control('StartIncomingPairing', 'hci0', KEYBOARD), 'accepted')
        self.assertEqual(self.btbusctl('create', HEADSET)[0], 0)
        self.assertTrue(run_until(lambda: self.call(self.device_path(HEADSET), 'org.bluez.Device',
                                                    'GetProperties')['Connected'], 5))
        self.assertEqual(self.btbusctl('audio', 'connect', HEADSET)[0], 0)
        for proc in (agent, watch):
            proc.send_signal(signal.SIGINT)
            self.assertEqual(proc.wait(10), 0)
        requests = [json.loads(line) for line in agent.stdout]
        self.assertEqual([(r['request'], r['device'], r['answer']) for r in requests][0],
                         ('RequestPinCode', KEYBOARD, '0000'))
        events = [json.loads(line) for line in watch.stdout]
        seen = [(e['event'], e['interface'].rsplit('.', 1)[1], e.get('name'), e['path']) for e in events]
        headset = self.device_path(HEADSET)
        for event in [('DeviceCreated', 'Adapter', None, self.adapter), ('Connected', 'AudioSink', None, headset),
                      ('PropertyChanged', 'Audio', 'State', headset), ('Connected', 'Control', None, headset)]:
            with self.subTest(event=event):
                self.assertIn(event, seen)
        self.assertEqual(seen.count(('Connected', 'AudioSink', None, headset)), 1)
        self.assertEqual([e['value'] for e in events if e.get('name') == 'State' and 'Sink' in e['interface']],
                         ['connecting', 'connected'])

    def events_until(self, proc, done, timeout=10):
        """The JSON events proc prints, up to the first for which done() holds."""
        seen = []

        def read():
            for line in proc.stdout:
                seen.append(json.loads(line))
                if done(seen[-1]):
                    return
        reader = threading.Thread(target=read, daemon=True)
        reader.start()
        reader.join(timeout)
        self.assertFalse(reader.is_alive(), f'not yet seen; seen: {seen}')
        return seen

    def test_agent_watch_and_scan_carry_on_when_bluetoothd_restarts(self):
        procs = {name: self.start(*args) for name, args in
                 (('agent', ('agent', '--pin', '0000')), ('watch', ('watch',)), ('scan', ('scan', '--timeout', '0')))}
        old, new = ({'address': '00:AA:00:00:00:0%d' % i, 'name': 'Thing'} for i in (1, 2))
        for name, first in (('agent', 'registered'), ('watch', 'watching'), ('scan', 'scanning')):
            self.events_until(procs[name], lambda e, first=first: e['event'] == first)
        self.control('AddDevice', 'hci0', json.dumps(old))
        self.events_until(procs['scan'], lambda e: e.get('address') == old['address'])
        before = self.adapter
        os.kill(self.launcher.proc.pid, signal.SIGHUP)  # a new bluetoothd: new paths, its own scene
        def default_adapter():
            try:
                return self.call('/', 'org.bluez.Manager', 'DefaultAdapter')
            except dbus.DBusException:  # gone, or not up yet
                return before
        self.assertTrue(run_until(lambda: default_adapter() != before, 10))
        self.adapter = default_adapter()
        for name, proc in procs.items():
            with self.subTest(restarted=name):
                self.assertEqual(self.events_until(proc, lambda e: e['event'] == 'restarted')[-1]['adapter'], 'hci0')
        self.control('AddDevice', 'hci0', json.dumps(new))
        found = self.events_until(procs['scan'], lambda e: e.get('address') == new['address'])
        self.assertNotIn(old['address'], [e.get('address') for e in found])
        self.assertEqual(self.control('StartIncomingPairing', 'hci0', KEYBOARD), 'accepted')
        self.assertEqual(self.events_until(procs['agent'], lambda e: e['event'] == 'request')[-1]['request'],
                         'RequestPinCode')
        self.events_until(procs['watch'], lambda e: e['event'] == 'DeviceCreated' and e['path'] == self.adapter)
        for proc in procs.values():
            proc.send_signal(signal.SIGINT)
            self.assertEqual(proc.wait(10), 0)


if __name__ == '__main__':
    unittest.main()
