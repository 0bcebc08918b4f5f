"""bluez4-sim from outside: startup, gdbus, properties, call log, EmitSignal, audio."""

import re
import subprocess
import time
import unittest
from xml.etree import ElementTree

import dbus

from simharness import SimTestCase

ADAPTER = 'org.bluez.Adapter'
HEADSET = '00:0D:3C:A1:B2:C3'


class BasicsTest(SimTestCase):

    def test_startup_time(self):
        print(f'\nstartup: {self.launcher.startup_seconds:.3f} s')
        self.assertLess(self.launcher.startup_seconds, 3.0)

    def test_gdbus_default_adapter(self):
        env = dict(self.launcher.env, PATH='/usr/bin:/bin')
        out = subprocess.run(['gdbus', 'call', '--system', '--dest', 'org.bluez', '--object-path', '/',
                              '--method', 'org.bluez.Manager.DefaultAdapter'],
                             env=env, capture_output=True, text=True, timeout=10, check=True).stdout
        self.assertRegex(out, r"^\(objectpath '/org/bluez/\d+/hci0',\)")
        self.assertIn(self.adapter, out)

    def test_adapter_properties_and_set_property(self):
        props = self.call(self.adapter, ADAPTER, 'GetProperties')
        self.assertEqual(list(props)[:4], ['Address', 'Name', 'Class', 'Powered'])
        self.assertTrue(props['Powered'])
        self.call(self.adapter, ADAPTER, 'SetProperty', 'Name', dbus.String('renamed', variant_level=1), signature='sv')
        self.wait_signal('PropertyChanged', self.adapter)
        self.assertEqual(self.signals[-1][3], ['Name', 'renamed'])
        self.assertEqual(self.call(self.adapter, ADAPTER, 'GetProperties')['Name'], 'renamed')

    def test_set_property_errors(self):
        invalid = 'org.bluez.Error.InvalidArguments'
        self.assert_error(invalid, self.adapter, ADAPTER, 'SetProperty', 'NoSuchThing', dbus.Boolean(True), signature='sv')
        self.assert_error(invalid, self.adapter, ADAPTER, 'SetProperty', 'Address', dbus.String('00:11:22:33:44:55'), signature='sv')
        self.assert_error(invalid, self.adapter, ADAPTER, 'SetProperty', 'Powered', dbus.String('yes'), signature='sv')
        self.assert_error(invalid, self.adapter, ADAPTER, 'SetProperty', 'DiscoverableTimeout', dbus.Int32(5), signature='sv')
        self.assert_error('org.freedesktop.DBus.Error.UnknownMethod', self.adapter, ADAPTER, 'SetProperty',
                          'Powered', True, signature='sb')
        self.call(self.adapter, ADAPTER, 'SetProperty', 'Powered', dbus.Boolean(False), signature='sv')
        self.assert_error('org.bluez.Error.NotReady', self.adapter, ADAPTER, 'SetProperty',
                          'Pairable', dbus.Boolean(True), signature='sv')
        self.drain()
        changes = [s[3][0] for s in self.signals if s[2] == 'PropertyChanged']
        self.assertEqual(changes, ['Pairable', 'Powered'])

    def test_call_log_lines(self):
        self.call(self.adapter, ADAPTER, 'SetProperty', 'Powered', dbus.Boolean(False), signature='sv')
        self.assert_error('org.bluez.Error.DoesNotExist', self.adapter, ADAPTER, 'FindDevice', 'zz')
        self.call('/', 'org.bluez.Manager', 'FindAdapter', 'hci0')
        self.assertEqual(list(self.control('GetCallLog')), [
            f'{self.adapter} org.bluez.Adapter.SetProperty(Powered, false)',
            f'{self.adapter} org.bluez.Adapter.FindDevice(zz)',
            '/ org.bluez.Manager.FindAdapter(hci0)'])
        self.control('ClearCallLog')
        self.assertEqual(list(self.control('GetCallLog')), [])

    def test_emit_signal_with_malformed_variant(self):
        self.control('EmitSignal', dbus.ObjectPath(self.adapter), ADAPTER, 'PropertyChanged', 'sv',
                     '["Powered", ["d", 1.5]]')
        self.wait_signal('PropertyChanged', self.adapter)
        name, value = self.signals[-1][3]
        self.assertEqual((name, value), ('Powered', 1.5))
        self.assertIsInstance(value, dbus.Double)
        self.control('EmitSignal', dbus.ObjectPath('/x'), 'org.example.T', 'Keys', 'a{us}v',
                     '[{"7": "seven"}, ["as", ["a"]]]')
        self.wait_signal('Keys', '/x')
        self.assertEqual(self.signals[-1][3], [{7: 'seven'}, ['a']])
        for bad in ('["Powered"]', '["Powered", ["d"]]', '["Powered", ["y", "x"]]', 'not json'):
            with self.assertRaises(dbus.DBusException) as ctx:
                self.control('EmitSignal', dbus.ObjectPath(self.adapter), ADAPTER, 'PropertyChanged', 'sv', bad)
            self.assertEqual(ctx.exception.get_dbus_name(), 'org.bluez.Error.InvalidArguments')

    def test_reset_is_quick_and_restores_the_scene(self):
        self.call(self.adapter, ADAPTER, 'SetProperty', 'Powered', dbus.Boolean(False), signature='sv')
        self.control('AddAdapter', 'hci1', '00:11:22:33:44:01')
        started = time.monotonic()
        self.control('Reset')
        elapsed = time.monotonic() - started
        print(f'\nreset: {elapsed * 1000:.1f} ms')
        self.assertLess(elapsed, 0.5)
        self.assertTrue(self.call(self.adapter, ADAPTER, 'GetProperties')['Powered'])
        self.assertEqual(list(self.call('/', 'org.bluez.Manager', 'ListAdapters')), [self.adapter])

    def test_reset_brings_a_device_back_in_range(self):
        self.control('SetInRange', 'hci0', HEADSET, False)
        self.control('Reset')
        # An out-of-range device could not start a connection.
        self.assertEqual(self.control('IncomingConnection', 'hci0', HEADSET, '0000110b-0000-1000-8000-00805f9b34fb'),
                         'org.bluez.Error.AgentNotAvailable')

    def test_unknown_member_is_a_plain_unknown_method_error(self):
        mouse = self.adapter + '/dev_00_1F_20_AB_CD_EF'
        error = self.assert_error('org.freedesktop.DBus.Error.UnknownMethod', mouse, 'org.bluez.AudioSink', 'IsConnected')
        self.assertEqual(error.get_dbus_message(),
                         'Method "IsConnected" on interface "org.bluez.AudioSink" doesn\'t exist')

    def test_introspection_declares_signals_with_their_argument_names(self):
        dev = self.call(self.adapter, ADAPTER, 'CreateDevice', HEADSET)
        cases = [('/', 'org.bluez.Manager', 'DefaultAdapterChanged', [('o', 'adapter')]),
                 (self.adapter, ADAPTER, 'DeviceFound', [('s', 'address'), ('a{sv}', 'values')]),
                 (self.adapter, ADAPTER, 'DeviceRemoved', [('o', 'device')]),
                 (dev, 'org.bluez.Device', 'PropertyChanged', [('s', 'name'), ('v', 'value')]),
                 (dev, 'org.bluez.AudioSink', 'Playing', []),
                 (dev, 'org.bluez.Control', 'Disconnected', [])]
        for path, iface, member, args in cases:
            with self.subTest(member=member, iface=iface):
                xml = ElementTree.fromstring(self.call(path, 'org.freedesktop.DBus.Introspectable', 'Introspect'))
                signal = xml.find(f"interface[@name='{iface}']/signal[@name='{member}']")
                self.assertIsNotNone(signal)
                self.assertEqual([(a.get('type'), a.get('name')) for a in signal], args)
                self.assertIsNone(xml.find(f"interface[@name='{iface}']/method[@name='{member}']"))
        self.assert_error('org.freedesktop.DBus.Error.UnknownMethod', self.adapter, ADAPTER, 'DeviceFound')

    def test_add_adapter_signal_order(self):
        path = self.control('AddAdapter', 'hci1', '00:11:22:33:44:01')
        self.assertTrue(re.match(r'/org/bluez/\d+/hci1$', path))
        self.drain()
        self.assertEqual([s[2] for s in self.signals], ['AdapterAdded', 'PropertyChanged'])
        self.control('RemoveAdapter', 'hci0')
        self.drain()
        self.assertEqual([s[2] for s in self.signals[2:]],
                         ['PropertyChanged', 'DefaultAdapterChanged', 'AdapterRemoved'])

    def test_audio_sink_connect_and_volume(self):
        dev = self.call(self.adapter, ADAPTER, 'CreateDevice', HEADSET)
        self.call(dev, 'org.bluez.AudioSink', 'Connect')
        self.assertTrue(self.call(dev, 'org.bluez.AudioSink', 'IsConnected'))
        self.wait_signal('Connected', dev)
        self.drain(0.1)
        sink = [(s[2], s[3]) for s in self.signals if s[1] == 'org.bluez.AudioSink']
        self.assertEqual(sink, [('PropertyChanged', ['State', 'connecting']), ('Connected', []),
                                ('PropertyChanged', ['Connected', True]),
                                ('PropertyChanged', ['State', 'connected'])])
        self.assertTrue(self.call(dev, 'org.bluez.Control', 'IsConnected'))
        self.call(dev, 'org.bluez.Control', 'VolumeUp')
        self.assert_error('org.bluez.Error.AlreadyConnected', dev, 'org.bluez.AudioSink', 'Connect')
        self.call(dev, 'org.bluez.AudioSink', 'Disconnect')
        self.assertFalse(self.call(dev, 'org.bluez.AudioSink', 'IsConnected'))
        self.assertIn(f'{dev} org.bluez.Control.VolumeUp()', list(self.control('GetCallLog')))

    def test_discover_services(self):
        dev = self.call(self.adapter, ADAPTER, 'CreateDevice', HEADSET)
        records = self.call(dev, 'org.bluez.Device', 'DiscoverServices', '0x110b')
        self.assertEqual(len(records), 1)
        xml = list(records.values())[0]
        self.assertTrue(xml.startswith('<?xml version="1.0" encoding="UTF-8" ?>\n\n<record>\n'))
        self.assertIn('<uuid value="0x110b" />', xml)
        self.assert_error('org.bluez.Error.InvalidArguments', dev, 'org.bluez.Device', 'DiscoverServices', 'zz')
        self.control('SetInRange', 'hci0', HEADSET, False)
        err = self.assert_error('org.bluez.Error.ConnectionAttemptFailed', dev, 'org.bluez.Device',
                                'DiscoverServices', '')
        self.assertEqual(err.get_dbus_message(), 'Host is down')


if __name__ == '__main__':
    unittest.main()
