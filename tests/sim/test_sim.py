"""bluez4-sim from outside: its launcher, what it answers as BlueZ 4 would, and its control interface."""

import json
import os
import pathlib
import signal
import subprocess
import tempfile
import unittest

import dbus
import dbus.bus
from dbus.lowlevel import (ErrorMessage, HANDLER_RESULT_HANDLED, HANDLER_RESULT_NOT_YET_HANDLED,
                           MESSAGE_TYPE_METHOD_CALL, MethodReturnMessage)

from simharness import CONTROL, LAUNCHER, ROUND_SECONDS, Launcher, SimTestCase, run_until

E = 'org.bluez.Error.'
INVALID, UNKNOWN_METHOD = E + 'InvalidArguments', 'org.freedesktop.DBus.Error.UnknownMethod'
ADAPTER, DEVICE, SINK = 'org.bluez.Adapter', 'org.bluez.Device', 'org.bluez.AudioSink'
HEADSET, KEYBOARD, PHONE = '00:0D:3C:A1:B2:C3', '00:12:A1:B0:00:42', '5C:F3:70:61:A0:17'
LAPTOP, MOUSE = '00:24:7E:11:22:33', '00:1F:20:AB:CD:EF'  # out of range; paired
NEAR = {'address': '00:BB:00:00:00:01', 'name': 'Near', 'class': 0x240404, 'rssi': -40, 'uuids': ['110b']}
QUIET = {'address': '00:BB:00:00:00:02', 'class': 0x5a020c, 'rssi': -77, 'legacy': True}
AWAY = {'address': '00:BB:00:00:00:03', 'name': 'Away', 'in_range': False}
ON, OFF = ('Discovering', True), ('Discovering', False)
# Takes a name on the session bus, and stays without noticing that the bus goes.
SERVICE = ('[D-BUS Service]\nName=org.btbus.Activated\nExec=/usr/bin/python3 -c "import dbus, time; '
           'dbus.SessionBus().request_name(\'org.btbus.Activated\'); time.sleep(600)"\n')


def children_of(pid):  # of its main thread, the only one of the launcher
    return [int(child) for child in pathlib.Path(f'/proc/{pid}/task/{pid}/children').read_text().split()]


def alive(pid):  # and no zombie
    try:
        return pathlib.Path(f'/proc/{pid}/stat').read_text().rsplit(')', 1)[1].split()[0] != 'Z'
    except OSError:
        return False


class LauncherTest(unittest.TestCase):

    def test_serves_on_private_buses_until_sigterm_then_stops_all_it_and_its_session_bus_started(self):
        scratch = self.enterContext(tempfile.TemporaryDirectory())
        pathlib.Path(scratch, 'org.btbus.Activated.service').write_text(SERVICE)
        launcher = Launcher('--service-dir', scratch)
        self.addCleanup(launcher.stop)
        children = children_of(launcher.proc.pid)
        self.assertEqual(sorted(pathlib.Path(f'/proc/{c}/comm').read_text().strip() for c in children),
                         ['dbus-daemon', 'dbus-daemon', 'python3'])
        session = dbus.bus.BusConnection(launcher.env['DBUS_SESSION_BUS_ADDRESS'])
        self.addCleanup(session.close)
        session.start_service_by_name('org.btbus.Activated')
        service = int(session.call_blocking('org.freedesktop.DBus', '/org/freedesktop/DBus', 'org.freedesktop.DBus',
                                            'GetConnectionUnixProcessID', 's', ['org.btbus.Activated']))

        # A second simulator, of another scene, on this session bus, which it takes for the system bus.
        pathlib.Path(scratch, 'scene.json').write_text(
            json.dumps({'adapters': [{'name': 'hci5', 'address': '00:11:22:33:44:55'}]}))
        guest = Launcher('--use-env-buses', '--scene', f'{scratch}/scene.json',
                         env=dict(os.environ, DBUS_SYSTEM_BUS_ADDRESS=launcher.env['DBUS_SESSION_BUS_ADDRESS']))
        self.assertEqual(guest.env, {})
        [guest_simulator] = children_of(guest.proc.pid)
        self.assertEqual(session.call_blocking('org.bluez', '/', 'org.bluez.Manager', 'DefaultAdapter', '', ()),
                         f'/org/bluez/{guest_simulator}/hci5')
        guest.proc.send_signal(signal.SIGINT)
        self.assertEqual(guest.stop(), 0)

        self.assertEqual(launcher.stop(), 0)
        self.assertEqual([pid for pid in [*children, service, guest_simulator] if alive(pid)], [])

    def test_a_scene_it_cannot_load_ends_it_with_status_2(self):
        done = subprocess.run([LAUNCHER, '--scene', 'no-such-scene.json'], capture_output=True, text=True, timeout=20)
        self.assertEqual((done.returncode, 'cannot load scene' in done.stderr), (2, True), done.stderr)


class Agent:
    """org.bluez.Agent at PATH: records calls as (member, *arguments), answers from `answers` (values or an error)."""

    PATH = dbus.ObjectPath('/test/agent')

    def __init__(self, bus):
        self.answers, self.calls = {}, []
        bus.add_message_filter(self.answer)

    def answer(self, bus, message):
        if message.get_type() != MESSAGE_TYPE_METHOD_CALL or message.get_path() != self.PATH:
            return HANDLER_RESULT_NOT_YET_HANDLED
        self.calls.append((message.get_member(), *message.get_args_list()))
        answer = self.answers.get(message.get_member(), [])
        error = isinstance(answer, str)
        reply = ErrorMessage(message, answer, 'no') if error else MethodReturnMessage(message)
        reply.append(*([] if error else answer))
        bus.send_message(reply)
        return HANDLER_RESULT_HANDLED


class BluezTest(SimTestCase):

    @classmethod
    def setUpClass(cls):
        super().setUpClass()
        cls.agent = Agent(cls.bus)

    def setUp(self):
        super().setUp()
        self.agent.answers, self.agent.calls = {}, []

    def call_waiting(self, path, iface, member, *args):
        """Calls while the main loop runs, so that the agent can answer meanwhile: (result, error)."""
        done = []
        self.bus.call_async('org.bluez', path, iface, member, None, args, lambda *result: done.append((*result, None)),
                            lambda error: done.append((None, error)), timeout=30)
        self.assertTrue(run_until(lambda: done), f'no answer to {member}')
        return done[0]

    def test_calls_in_turn_get_the_errors_bluez_names_or_succeed_sending_the_signals_they_should(self):
        """Each row in turn: the error a call gets (None: it succeeds, for the rows after it)."""
        a, headset, agent, other = self.adapter, self.device_path(HEADSET), Agent.PATH, dbus.ObjectPath('/other')
        rows = [(None, a, ADAPTER, 'SetProperty', 'Name', dbus.String('renamed', variant_level=1)),
                (INVALID, a, ADAPTER, 'SetProperty', 'NoSuchThing', dbus.Boolean(True, variant_level=1)),
                (INVALID, a, ADAPTER, 'SetProperty', 'Address', dbus.String('00:11:22:33:44:55', variant_level=1)),
                (INVALID, a, ADAPTER, 'SetProperty', 'Powered', dbus.String('yes', variant_level=1)),
                (INVALID, a, ADAPTER, 'SetProperty', 'DiscoverableTimeout', dbus.Int32(5, variant_level=1)),
                (UNKNOWN_METHOD, a, ADAPTER, 'SetProperty', 'Powered', True),  # not in a variant
                (E + 'DoesNotExist', a, ADAPTER, 'FindDevice', 'zz'),
                (UNKNOWN_METHOD, self.device_path(MOUSE), SINK, 'IsConnected'),  # the mouse has no audio
                (INVALID, a, ADAPTER, 'CreatePairedDevice', '00:AA', agent, ''),
                (INVALID, a, ADAPTER, 'CreatePairedDevice', PHONE, agent, 'Telepathy'),
                (E + 'AlreadyExists', a, ADAPTER, 'CreatePairedDevice', MOUSE, agent, ''),
                ((E + 'ConnectionAttemptFailed', 'Page Timeout'), a, ADAPTER, 'CreatePairedDevice', LAPTOP, agent, ''),
                (INVALID, a, ADAPTER, 'RegisterAgent', agent, 'Nope'),
                (None, a, ADAPTER, 'RegisterAgent', agent, ''),
                (E + 'AlreadyExists', a, ADAPTER, 'RegisterAgent', other, ''),
                (E + 'DoesNotExist', a, ADAPTER, 'UnregisterAgent', other),
                (None, a, ADAPTER, 'CreateDevice', HEADSET),
                (INVALID, headset, DEVICE, 'DiscoverServices', 'zz'),
                (None, headset, SINK, 'Connect'),
                (E + 'AlreadyConnected', headset, SINK, 'Connect'),
                (E + 'NoSuchAdapter', *CONTROL, 'SetInRange', 'hci9', HEADSET, False),
                (E + 'DoesNotExist', *CONTROL, 'SetInRange', 'hci0', '00:00:00:00:00:09', False),
                (INVALID, *CONTROL, 'IncomingConnection', 'hci0', HEADSET, 'not a uuid'),
                (None, *CONTROL, 'SetInRange', 'hci0', HEADSET, False),
                ((E + 'ConnectionAttemptFailed', 'Host is down'), headset, DEVICE, 'DiscoverServices', ''),
                (E + 'NotAvailable', *CONTROL, 'IncomingConnection', 'hci0', HEADSET, '110b'),
                (None, *CONTROL, 'EmitSignal', dbus.ObjectPath('/x'), 'org.example.T', 'Keys', 'a{us}v',
                 '[{"7": "seven"}, ["as", ["a"]]]'),
                *[(INVALID, *CONTROL, 'EmitSignal', a, ADAPTER, 'PropertyChanged', 'sv', bad)
                  for bad in ('["Powered"]', '["Powered", ["d"]]', '["Powered", ["y", "x"]]', 'not json')],
                (None, a, ADAPTER, 'SetProperty', 'Powered', dbus.Boolean(False, variant_level=1)),
                (E + 'NotReady', a, ADAPTER, 'SetProperty', 'Pairable', dbus.Boolean(True, variant_level=1)),
                (E + 'NotReady', a, ADAPTER, 'StartDiscovery'),
                (E + 'NotReady', *CONTROL, 'StartIncomingPairing', 'hci0', PHONE)]
        for error, *call in rows:
            with self.subTest(call=call):
                if error:
                    self.assert_error(error, *call)
                else:
                    self.call(*call)
        self.assertEqual(self.wait_signal('Keys', '/x'), [{7: 'seven'}, ['a']])
        self.drain()  # only a SetProperty that succeeds changes a property
        self.assertEqual([args for path, _i, member, args in self.signals if path == a and member == 'PropertyChanged'
                          and args[0] in ('Name', 'Address', 'Powered', 'DiscoverableTimeout', 'Pairable')],
                         [['Name', 'renamed'], ['Pairable', False], ['Powered', False]])

    def test_adapters_come_and_go_with_the_managers_signals_and_reset_restores_the_scene(self):
        self.call(self.adapter, ADAPTER, 'SetProperty', 'Powered', dbus.Boolean(False, variant_level=1))
        self.control('SetInRange', 'hci0', HEADSET, False)
        self.assertRegex(self.control('AddAdapter', 'hci1', '00:11:22:33:44:01'), r'^/org/bluez/\d+/hci1$')
        self.control('RemoveAdapter', 'hci0')
        self.drain()
        self.assertEqual([member for path, _i, member, _a in self.signals if path == '/'],
                         'AdapterAdded PropertyChanged PropertyChanged DefaultAdapterChanged AdapterRemoved'.split())
        self.control('Reset')
        self.assertEqual(self.call('/', 'org.bluez.Manager', 'ListAdapters'), [self.adapter])
        self.assertEqual(list(self.call(self.adapter, ADAPTER, 'GetProperties').items())[:4], [
            ('Address', '00:1A:7D:DA:71:13'), ('Name', 'btbus-sim'), ('Class', 0x5a010c), ('Powered', True)])
        # In range again: an out-of-range headset could not ask for a connection.
        self.assertEqual(self.control('IncomingConnection', 'hci0', HEADSET, '110b'), E + 'AgentNotAvailable')

    def discovery(self):
        """The adapter's discovery signals, as ON, OFF or (member, address)."""
        return [('Discovering', bool(args[1])) if member == 'PropertyChanged' else (member, args[0])
                for path, _i, member, args in self.signals if path == self.adapter and
                (member in ('DeviceFound', 'DeviceDisappeared') or args[:1] == ['Discovering'])]

    def test_discovery_goes_in_rounds_until_stopped_and_a_device_gone_disappears_after_one(self):
        self.control('LoadScene', json.dumps({'adapters': [{'name': 'hci0', 'address': '00:BB:00:00:00:AA',
                                                            'devices': [NEAR, QUIET, AWAY]}]}))
        self.addCleanup(self.control, 'LoadScene', pathlib.Path(LAUNCHER).with_name('default-scene.json').read_text())
        near, quiet = ('DeviceFound', NEAR['address']), ('DeviceFound', QUIET['address'])
        self.call(self.adapter, ADAPTER, 'StartDiscovery')
        self.assertTrue(run_until(lambda: OFF in self.discovery()))
        self.assertEqual(self.discovery()[:4], [ON, near, quiet, OFF])
        found = {args[0]: args[1] for _p, _i, member, args in self.signals if member == 'DeviceFound'}
        near_found, quiet_found = found[NEAR['address']], found[QUIET['address']]
        self.assertEqual(list(near_found), ['Address', 'Class', 'Icon', 'RSSI', 'Name', 'Alias', 'LegacyPairing',
                                            'Paired', 'Trusted', 'UUIDs'])
        self.assertEqual((near_found['RSSI'], type(near_found['RSSI']), near_found['UUIDs']),
                         (-40, dbus.Int16, ['0000110b-0000-1000-8000-00805f9b34fb']))
        self.assertEqual(('Name' in quiet_found, quiet_found['Alias'], quiet_found['LegacyPairing']),
                         (False, QUIET['address'].replace(':', '-'), True))

        self.control('SetInRange', 'hci0', NEAR['address'], False)
        gone = ('DeviceDisappeared', NEAR['address'])
        self.assertTrue(run_until(lambda: gone in self.discovery()))
        events = self.discovery()
        at = events.index(gone)
        self.assertEqual(events[at - 1], OFF)  # at the end of a round without it
        self.assertNotIn(near, events[max(i for i in range(at) if events[i] == ON):at])
        self.call(self.adapter, ADAPTER, 'StopDiscovery')  # in a later round
        self.drain(1.5 * ROUND_SECONDS)
        events = self.discovery()
        self.assertEqual((events[-1], events.count(OFF)), (OFF, events.count(ON)))
        # Started again, by another: its own rounds, none of the first start's; only it may stop them,
        # and they stop when it leaves the bus.
        del self.signals[:]
        other = dbus.bus.BusConnection(self.launcher.env['DBUS_SYSTEM_BUS_ADDRESS'])
        other.call_blocking('org.bluez', self.adapter, ADAPTER, 'StartDiscovery', '', ())
        self.assertTrue(run_until(lambda: self.discovery().count(quiet) >= 2))
        self.assert_error(E + 'Failed', self.adapter, ADAPTER, 'StopDiscovery')
        other.close()
        self.assertTrue(run_until(lambda: not self.call(self.adapter, ADAPTER, 'GetProperties')['Discovering']))
        self.drain(1.5 * ROUND_SECONDS)
        events = self.discovery()
        self.assertEqual(events, [ON, quiet, OFF] * events.count(quiet))

    def test_pairing_asks_the_agent_as_the_device_needs_and_keeps_only_a_paired_device(self):
        # (device, capability, the agent's request, its answer, the error); the agent is released after
        rows = [(KEYBOARD, 'DisplayYesNo', 'RequestPinCode', ['0000'], None),
                (KEYBOARD, '', 'RequestPinCode', ['7391'], 'AuthenticationFailed'),
                (PHONE, 'KeyboardOnly', 'RequestPasskey', [dbus.UInt32(482913)], None),
                (PHONE, 'DisplayYesNo', 'RequestConfirmation', [], None),
                (PHONE, 'DisplayYesNo', 'RequestConfirmation', E + 'Rejected', 'AuthenticationFailed')]
        for address, capability, request, answer, error in rows:
            with self.subTest(request=request, answer=answer):
                self.setUp()
                self.agent.answers = {request: answer}
                path, failure = self.call_waiting(self.adapter, ADAPTER, 'CreatePairedDevice', address, Agent.PATH,
                                                  capability)
                self.assertEqual((path, failure and failure.get_dbus_name()),
                                 (None, E + error) if error else (self.device_path(address), None))
                # A failed pairing drops the device, after the Release: waited for too.
                members = lambda: [s[2] for s in self.signals]  # noqa: E731
                self.assertTrue(run_until(lambda: [c[0] for c in self.agent.calls] == [request, 'Release'] and
                                          (not error or 'DeviceRemoved' in members())), (self.agent.calls, members()))
                self.drain()
                self.assertEqual(members()[0], 'DeviceCreated')
                self.assertEqual(('DeviceRemoved' in members(), ['Paired', True] in [s[3] for s in self.signals]),
                                 (bool(error), not error))

    def test_incoming_requests_go_to_the_registered_agent_unless_the_device_is_trusted(self):
        self.assertEqual(self.control('StartIncomingPairing', 'hci0', PHONE), E + 'AgentNotAvailable')
        self.call(self.adapter, ADAPTER, 'RegisterAgent', Agent.PATH, 'DisplayYesNo')
        self.assertEqual(self.call_waiting(*CONTROL, 'StartIncomingPairing', 'hci0', PHONE), ('accepted', None))
        rejected = self.agent.answers['Authorize'] = E + 'Rejected'
        self.assertEqual(self.call_waiting(*CONTROL, 'IncomingConnection', 'hci0', PHONE, '1105'), (rejected, None))
        phone = self.device_path(PHONE)
        self.assertEqual(self.agent.calls, [('RequestConfirmation', phone, 482913),
                                            ('Authorize', phone, '00001105-0000-1000-8000-00805f9b34fb')])
        self.assertEqual(self.control('IncomingConnection', 'hci0', MOUSE, '1124'), 'trusted')


if __name__ == '__main__':
    unittest.main()
