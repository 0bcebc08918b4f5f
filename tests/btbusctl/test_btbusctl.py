"""btbusctl end to end: every command, as a shell runs it, against bluez4-sim on private buses."""

import json
import os
import select
import signal
import subprocess
import tempfile
import time
import unittest

from simharness import SimTestCase

# Through the emulator that runs the target's programs, in a cross-built run.
BTBUSCTL = [*os.environ.get('BTBUS_TEST_EMULATOR', '').split(), os.environ['BTBUSCTL']]
IN_PRIVATE_MOUNTS = os.path.join(os.path.dirname(__file__), '..', '..', 'scripts', 'in-private-mounts.sh')
# Runs the commands of argv[1] (JSON) and prints their [status, stdout, stderr] as JSON.
RUNNER = ('import json, subprocess, sys\n'
          'done = [subprocess.run(c, capture_output=True, text=True) for c in json.loads(sys.argv[1])]\n'
          'print(json.dumps([[d.returncode, d.stdout, d.stderr] for d in done]))')
ADAPTER, SINK = 'org.bluez.Adapter', 'org.bluez.AudioSink'
HEADSET, KEYBOARD, PHONE, MOUSE = '00:0D:3C:A1:B2:C3', '00:12:A1:B0:00:42', '5C:F3:70:61:A0:17', '00:1F:20:AB:CD:EF'
HCI0 = '00:1A:7D:DA:71:13'  # the adapter's address
PIN_REQUEST = {'request': 'RequestPinCode', 'device': KEYBOARD, 'answer': '0000'}


class BtbusctlTest(SimTestCase):

    extra_args = ('--service-dir', os.environ['BTBUS_SERVICE_DIR'])  # the scanner service

    def btbusctl(self, *args, env=None):
        done = subprocess.run([*BTBUSCTL, *args], env=env or self.launcher.env, capture_output=True,
                              text=True, timeout=30)
        return done.returncode, done.stdout, done.stderr

    def start(self, *args):
        # Unbuffered: a line read leaves the next in the pipe, for select().
        proc = subprocess.Popen([*BTBUSCTL, '--json', *args], env=self.launcher.env, stdout=subprocess.PIPE, bufsize=0)
        for cleanup in (proc.stdout.close, proc.wait, proc.kill):  # kill: unless it was stopped
            self.addCleanup(cleanup)
        return proc

    def property(self, name):
        return self.call(self.adapter, ADAPTER, 'GetProperties')[name]

    def check(self, cases, results):
        """Cases: (arguments, exit status, a check of the output (parsed, after --json), or a text of it
        (of stderr, if it fails), ...); results: theirs, (status, stdout, stderr) in order."""
        for (args, status, check, *_), (code, out, err) in zip(cases, results):
            with self.subTest(args=args):
                self.assertEqual(code, status, err)
                if callable(check):
                    check(json.loads(out) if args[0] == '--json' else out)
                elif status:
                    self.assertEqual((out, check in err), ('', True), err)
                else:
                    self.assertIn(check, out)

    def test_one_shot_commands(self):
        """Run in order, each with --json."""
        eq, le, prop, headset = self.assertEqual, self.assertLessEqual, self.property, self.device_path(HEADSET)
        cases = [
            (['adapters'], 0, lambda out: eq([(a['adapter'], a['address'], a['powered'], a['default']) for a in out],
                                             [('hci0', HCI0, True, True)])),
            (['show', 'hci0'], 0, lambda out: (self.assertIn('HCIVersion', out), eq(out['Name'], prop('Name')))),
            (['set', 'hci0', 'Powered', 'off'], 0, lambda out: eq((out['value'], prop('Powered')), (False, False))),
            (['set', 'hci0', 'Pairable', 'yes'], 1, 'did not apply Pairable'),
            (['scan'], 1, 'the adapter is off'),
            (['set', 'hci0', 'Powered', 'on'], 0, lambda out: eq(prop('Powered'), True)),
            (['set', 'hci0', 'DiscoverableTimeout', '30'], 0, lambda _: eq(prop('DiscoverableTimeout'), 30)),
            (['-a', HCI0, 'set', 'hci0', 'Name', 'front desk'], 0, lambda _: eq(prop('Name'), 'front desk')),
            (['-a', 'hci7', 'devices'], 1, 'No such adapter'),
            (['devices'], 0, lambda out: eq([(d['Address'], d['Paired']) for d in out], [(MOUSE, True)])),
            (['info', MOUSE], 0, lambda out: eq(out['Path'], self.device_path(MOUSE))),
            (['info', HEADSET], 1, 'Does Not Exist'),
            (['services', HEADSET], 1, 'Does Not Exist'),
            (['audio', 'connect', HEADSET], 1, 'Does Not Exist'),
            (['create', HEADSET], 0, lambda out: eq(out['path'], headset)),
            (['services', HEADSET, '0x110b'], 0, lambda out: eq(len(out['records']), 1)),
            (['volume', 'up', HEADSET], 1, 'not connected'),
            (['audio', 'connect', HEADSET], 0, lambda out: eq(out['state'], 'connected')),
            (['audio', 'status', HEADSET], 0, lambda out: eq((out['sink'], out['control']), (True, True))),
            (['volume', 'down', HEADSET], 0,
             lambda _: self.assertIn(f'{headset} org.bluez.Control.VolumeDown()', self.control('GetCallLog'))),
            (['audio', 'disconnect', HEADSET], 0, lambda out: eq(out['state'], 'disconnected')),
            (['audio', 'status', MOUSE], 1, "doesn't exist"),
            (['pair', KEYBOARD, '--pin', '1234'], 1, 'Authentication Failed'),
            (['pair', KEYBOARD, '--pin', '0000'], 0, lambda out: le(PIN_REQUEST.items(), out['requests'][0].items())),
            (['pair', PHONE, '--reject'], 1, 'Authentication Failed'),
            (['pair', PHONE, '--capability', 'KeyboardOnly', '--passkey', '482913'], 0,
             lambda out: eq(out['requests'][0]['request'], 'RequestPasskey')),
            (['remove', MOUSE], 0, lambda _: self.assertNotIn(self.device_path(MOUSE), prop('Devices'))),
            (['remove', MOUSE], 1, 'Does Not Exist'),
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
        cases = [(['--json', *args], status, check) for args, status, check in cases]
        self.check(cases, (self.btbusctl(*args) for args, _, _ in cases))  # each run when the last was checked

    def test_autoconnect_and_restart_in_private_mounts(self):
        if os.geteuid() != 0 or subprocess.run(['unshare', '-m', 'true'], capture_output=True).returncode:
            self.skipTest("needs root and 'unshare -m' to keep /etc and /tmp private")
        eq, file = self.assertEqual, '/etc/bluetooth/autoconnect/' + HCI0
        cases = [(['--json', 'autoconnect', 'show'], 0, lambda out: eq((out['enabled'], out['devices'], out['file']),
                                                                       (False, [], file))),
                 (['--json', 'autoconnect', 'add', MOUSE.lower()], 0, lambda out: eq(out['devices'], [MOUSE])),
                 (['autoconnect', 'add', HEADSET], 1, 'Does Not Exist'),
                 (['--json', 'autoconnect', 'enable'], 0, lambda out: eq(out['enabled'], True)),
                 (['cat', file], 0, lambda out: eq(out, '1,' + MOUSE)),
                 (['autoconnect', 'pause'], 1, 'no auto-connect daemon reads /tmp/quill_bluetooth_autoconnect'),
                 (['--json', 'autoconnect', 'remove', MOUSE], 0,
                  lambda out: eq((out['enabled'], out['devices']), (True, []))),
                 (['restart-daemon'], 1, 'no adapter is attached')]
        scratch = tempfile.mkdtemp()
        self.addCleanup(os.rmdir, scratch)
        commands = [args if args[0] == 'cat' else [*BTBUSCTL, *args] for args, _, _ in cases]
        out = subprocess.run([IN_PRIVATE_MOUNTS, scratch, '/usr/bin/python3', '-c', RUNNER, json.dumps(commands)],
                             env=self.launcher.env, capture_output=True, text=True, timeout=60, check=True).stdout
        self.check(cases, json.loads(out))
        self.assertFalse(os.path.exists(file))

    def test_human_output_help_version_and_a_missing_bus_or_daemon(self):
        session = dict(self.launcher.env, DBUS_SYSTEM_BUS_ADDRESS=self.launcher.env['DBUS_SESSION_BUS_ADDRESS'])
        nowhere = dict(self.launcher.env, DBUS_SYSTEM_BUS_ADDRESS='unix:path=/nonexistent/btbus-test')
        no_session = {'DBUS_SYSTEM_BUS_ADDRESS': self.launcher.env['DBUS_SYSTEM_BUS_ADDRESS']}
        cases = [(['adapters'], 0, f'hci0  {HCI0}  powered', None),
                 (['info', MOUSE], 0, 'Paired: yes', None),
                 (['--help'], 0, 'watch', None),
                 (['pair', '--help'], 0, '--capability', None),
                 (['--version'], 0, 'btbusctl ', None),
                 (['devices'], 1, 'btbusctl: bluetoothd is not running on the system bus', session),
                 (['--json', 'adapters'], 1, 'btbusctl: cannot reach the system bus', nowhere),
                 (['scan', '--shared'], 1, 'btbusctl: the scanner service lives on the session bus, '
                                           'and DBUS_SESSION_BUS_ADDRESS is not set\n', no_session)]
        self.check(cases, (self.btbusctl(*args, env=env) for args, _, _, env in cases))

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

    def events_until(self, proc, done, timeout=10):
        """The JSON events proc prints, up to the first for which done() holds."""
        seen, deadline = [], time.monotonic() + timeout
        while not seen or not done(seen[-1]):
            ready = select.select([proc.stdout], [], [], deadline - time.monotonic())[0]
            self.assertTrue(ready, f'not yet seen; seen: {seen}')
            seen.append(json.loads(proc.stdout.readline()))
        return seen

    def test_agent_watch_and_scan_report_each_event_once_and_carry_on_when_bluetoothd_restarts(self):
        procs = {name: self.start(*args) for name, args in
                 (('agent', ('agent', '--pin', '0000')), ('watch', ('watch',)), ('scan', ('scan', '--timeout', '0')))}
        old, new = ({'address': '00:AA:00:00:00:0%d' % i, 'name': 'Thing'} for i in (1, 2))
        for name, first in (('agent', 'registered'), ('watch', 'watching'), ('scan', 'scanning')):
            self.events_until(procs[name], lambda e, first=first: e['event'] == first)
        self.control('AddDevice', 'hci0', json.dumps(old))
        self.events_until(procs['scan'], lambda e: e.get('address') == old['address'])
        before = self.adapter
        os.kill(self.launcher.proc.pid, signal.SIGHUP)  # a new bluetoothd: new paths, its own scene
        for name, proc in procs.items():
            with self.subTest(restarted=name):
                self.assertEqual(self.events_until(proc, lambda e: e['event'] == 'restarted')[-1]['adapter'], 'hci0')
        self.adapter = self.call('/', 'org.bluez.Manager', 'DefaultAdapter')
        self.assertNotEqual(self.adapter, before)
        self.assertEqual(self.wait_signal('AdapterAdded', '/'), [self.adapter])  # as bluetoothd announces it
        self.control('AddDevice', 'hci0', json.dumps(new))
        found = self.events_until(procs['scan'], lambda e: e.get('address') == new['address'])
        self.assertNotIn(old['address'], [e.get('address') for e in found])
        self.assertEqual(self.control('StartIncomingPairing', 'hci0', KEYBOARD), 'accepted')
        request = self.events_until(procs['agent'], lambda e: e['event'] == 'request')[-1]
        self.assertLessEqual(PIN_REQUEST.items(), request.items())
        self.assertEqual(self.btbusctl('create', HEADSET)[0], 0)
        self.assertEqual(self.btbusctl('audio', 'connect', HEADSET)[0], 0)
        # Since the restart, up to the last signal bluetoothd sends.
        events = self.events_until(procs['watch'], lambda e: 'Control' in e.get('interface', '') and 'name' in e)
        for proc in procs.values():
            proc.send_signal(signal.SIGINT)
            self.assertEqual(proc.wait(10), 0)
        seen = [(e['event'], e['interface'].rsplit('.', 1)[1], e.get('name'), e['path']) for e in events]
        headset = self.device_path(HEADSET)
        self.assertLessEqual({('DeviceCreated', 'Adapter', None, self.adapter), ('Connected', 'Control', None, headset),
                              ('PropertyChanged', 'Audio', 'State', headset)}, set(seen))
        # Once each, in bluetoothd's order.
        self.assertEqual([(e['event'], e.get('name'), e.get('value')) for e in events if e['interface'] == SINK],
                         [('PropertyChanged', 'State', 'connecting'), ('Connected', None, None),
                          ('PropertyChanged', 'Connected', True), ('PropertyChanged', 'State', 'connected')])

if __name__ == '__main__':
    unittest.main()
