"""Discovery: signal order over rounds, DeviceFound contents, sessions."""

import json
import unittest

import dbus

from simharness import ROUND_SECONDS, SimTestCase, run_until

ADAPTER = 'org.bluez.Adapter'
NEAR = {'address': '00:BB:00:00:00:01', 'name': 'Near', 'class': 0x240404, 'rssi': -40,
        'uuids': ['110b']}
QUIET = {'address': '00:BB:00:00:00:02', 'class': 0x5a020c, 'rssi': -77, 'legacy': True}
AWAY = {'address': '00:BB:00:00:00:03', 'name': 'Away', 'in_range': False}
SCENE = {'adapters': [{'name': 'hci0', 'address': '00:BB:00:00:00:AA', 'devices': [NEAR, QUIET, AWAY]}]}


class DiscoveryTest(SimTestCase):

    def setUp(self):
        super().setUp()
        self.control('LoadScene', json.dumps(SCENE))
        self.adapter = self.call('/', 'org.bluez.Manager', 'DefaultAdapter')

    def adapter_events(self):
        """(member, first argument) of the adapter's signals, Discovering changes as ('Discovering', b)."""
        events = []
        for path, _iface, member, args in self.signals:
            if path != self.adapter:
                continue
            if member == 'PropertyChanged' and args[0] == 'Discovering':
                events.append(('Discovering', bool(args[1])))
            elif member in ('DeviceFound', 'DeviceDisappeared'):
                events.append((member, str(args[0])))
        return events

    def test_rounds_and_disappearing_device(self):
        self.call(self.adapter, ADAPTER, 'StartDiscovery')
        self.assertTrue(run_until(lambda: self.adapter_events().count(('Discovering', False)) >= 1, 5))
        first = self.adapter_events()
        self.assertEqual(first[0], ('Discovering', True))
        self.assertEqual(sorted(first[1:3]), [('DeviceFound', NEAR['address']), ('DeviceFound', QUIET['address'])])
        self.assertEqual(first[3], ('Discovering', False))

        self.control('SetInRange', 'hci0', NEAR['address'], False)
        self.assertTrue(run_until(lambda: ('DeviceDisappeared', NEAR['address']) in self.adapter_events(),
                                  4 * ROUND_SECONDS + 2))
        events = self.adapter_events()
        gone = events.index(('DeviceDisappeared', NEAR['address']))
        self.assertEqual(events[gone - 1], ('Discovering', False))
        round_start = max(i for i, e in enumerate(events[:gone]) if e == ('Discovering', True))
        self.assertNotIn(('DeviceFound', NEAR['address']), events[round_start:gone])

        self.call(self.adapter, ADAPTER, 'StopDiscovery')
        self.drain(ROUND_SECONDS + 0.1)
        self.assertFalse(self.call(self.adapter, ADAPTER, 'GetProperties')['Discovering'])
        self.assertEqual(self.adapter_events()[-1], ('Discovering', False))

    def test_stop_in_a_later_round_ends_the_rounds(self):
        """Stopped in its second round, then restarted: one round cycle, no stray Discovering."""
        rounds = lambda: self.adapter_events().count(('Discovering', True))  # noqa: E731
        self.call(self.adapter, ADAPTER, 'StartDiscovery')
        self.assertTrue(run_until(lambda: rounds() >= 2, 3 * ROUND_SECONDS + 2))
        self.call(self.adapter, ADAPTER, 'StopDiscovery')
        self.drain(1.5 * ROUND_SECONDS)
        stopped = self.adapter_events()
        self.assertEqual(stopped[-1], ('Discovering', False))
        self.assertEqual(stopped.count(('Discovering', False)), rounds())

        del self.signals[:]
        self.call(self.adapter, ADAPTER, 'StartDiscovery')
        self.assertTrue(run_until(lambda: rounds() >= 3, 4 * ROUND_SECONDS + 2))
        self.drain()
        self.call(self.adapter, ADAPTER, 'StopDiscovery')
        self.drain(1.5 * ROUND_SECONDS)
        events = self.adapter_events()
        one_round = [('Discovering', True), ('DeviceFound', NEAR['address']),
                     ('DeviceFound', QUIET['address']), ('Discovering', False)]
        self.assertEqual(events, one_round * rounds())

    def test_device_found_dictionary(self):
        self.call(self.adapter, ADAPTER, 'StartDiscovery')
        self.wait_signal('DeviceFound')
        self.drain()
        found = {str(s[3][0]): s[3][1] for s in self.signals if s[2] == 'DeviceFound'}
        near = found[NEAR['address']]
        self.assertEqual(list(near), ['Address', 'Class', 'Icon', 'RSSI', 'Name', 'Alias',
                                      'LegacyPairing', 'Paired', 'Trusted', 'UUIDs'])
        self.assertIsInstance(near['RSSI'], dbus.Int16)
        self.assertEqual(near['RSSI'], NEAR['rssi'])
        self.assertEqual(list(near['UUIDs']), ['0000110b-0000-1000-8000-00805f9b34fb'])
        quiet = found[QUIET['address']]
        self.assertNotIn('Name', quiet)
        self.assertEqual(quiet['Alias'], QUIET['address'].replace(':', '-'))
        self.assertTrue(quiet['LegacyPairing'])
        self.assertNotIn(AWAY['address'], found)

    def test_sessions_are_per_sender(self):
        self.assert_error('org.bluez.Error.Failed', self.adapter, ADAPTER, 'StopDiscovery')
        other = dbus.bus.BusConnection(self.launcher.env['DBUS_SYSTEM_BUS_ADDRESS'])
        other.call_blocking('org.bluez', self.adapter, ADAPTER, 'StartDiscovery', '', ())
        self.wait_signal('DeviceFound')
        other.close()  # the owner leaving the bus ends its session
        self.assertTrue(run_until(lambda: not self.call(self.adapter, ADAPTER, 'GetProperties')['Discovering'], 3))

    def test_not_ready_while_off(self):
        self.call(self.adapter, ADAPTER, 'SetProperty', 'Powered', dbus.Boolean(False), signature='sv')
        self.assert_error('org.bluez.Error.NotReady', self.adapter, ADAPTER, 'StartDiscovery')


if __name__ == '__main__':
    unittest.main()
