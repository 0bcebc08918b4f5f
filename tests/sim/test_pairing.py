"""Pairing round trips with an agent exported by the test process."""

import json
import unittest

import dbus

from simharness import AsyncCall, SimTestCase, TestAgent, rejected, run_until

ADAPTER = 'org.bluez.Adapter'
PIN_DEVICE = {'address': '00:AA:00:00:00:01', 'name': 'Pin Kbd', 'legacy': True, 'pin': '8345'}
SSP_DEVICE = {'address': '00:AA:00:00:00:02', 'name': 'Pad', 'io': 'DisplayYesNo', 'passkey': 271828}


class PairingTest(SimTestCase):

    def setUp(self):
        super().setUp()
        self.agent = TestAgent(self.bus, '/test/agent')
        self.addCleanup(self.agent.remove_from_connection)
        self.scene()

    def scene(self):
        """The starting scene, the two devices added, nothing recorded."""
        self.control('Reset')
        self.control('AddDevice', 'hci0', json.dumps(PIN_DEVICE))
        self.control('AddDevice', 'hci0', json.dumps(SSP_DEVICE))
        self.control('ClearCallLog')
        self.drain()
        del self.signals[:]
        del self.agent.calls[:]

    def pair(self, device, capability, timeout=10):
        return AsyncCall(self.bus, self.adapter, ADAPTER, 'CreatePairedDevice', 'sos',
                         [device['address'], self.agent.path, capability]).wait(timeout)

    def assert_paired(self, call, device):
        self.assertIsNone(call.error)
        self.assertEqual(call.result, self.device_path(device['address']))
        props = self.call(call.result, 'org.bluez.Device', 'GetProperties')
        self.assertTrue(props['Paired'])
        self.assertEqual(self.agent.members()[-1], 'Release')

    def test_each_kind_of_request_and_its_outcome(self):
        """(device, capability, the agent's answer, error or None, the agent's calls after the first)"""
        passkey = dbus.UInt32(SSP_DEVICE['passkey'])
        rows = [(PIN_DEVICE, 'DisplayYesNo', ('RequestPinCode', PIN_DEVICE['pin']), None, ['Release']),
                (PIN_DEVICE, '', ('RequestPinCode', PIN_DEVICE['pin'] + '9'), 'AuthenticationFailed', []),
                (SSP_DEVICE, 'KeyboardOnly', ('RequestPasskey', passkey), None, ['Release']),
                (SSP_DEVICE, 'DisplayYesNo', ('RequestConfirmation', ''), None, ['Release']),
                (SSP_DEVICE, 'DisplayYesNo', ('RequestConfirmation', rejected()), 'AuthenticationFailed', ['Release'])]
        for device, capability, (request, answer), error, after in rows:
            with self.subTest(request=request, capability=capability, error=error):
                self.scene()
                self.agent.answers = {request: answer}
                call = self.pair(device, capability)
                dev = self.device_path(device['address'])
                self.assertEqual(self.agent.calls[0], (request, dev, *([SSP_DEVICE['passkey']] if request ==
                                                                         'RequestConfirmation' else [])))
                log = f'agent {self.bus.get_unique_name()} /test/agent org.bluez.Agent.{request}({dev}'
                self.assertIn(log, list(self.control('GetCallLog'))[1])
                if error:
                    self.assertEqual(call.error.get_dbus_name(), 'org.bluez.Error.' + error)
                else:
                    self.assert_paired(call, device)
                self.assertTrue(run_until(lambda: self.agent.members()[1:] == after, 5))
                self.drain()
                members = [m for _p, _i, m, _a in self.signals]
                self.assertEqual(members[0], 'DeviceCreated')
                self.assertEqual('DeviceRemoved' in members, error is not None)  # a failed pairing drops it
                self.assertEqual(['Paired', True] in [a for _p, _i, _m, a in self.signals], error is None)

    def test_errors(self):
        self.assert_error('org.bluez.Error.InvalidArguments', self.adapter, ADAPTER, 'CreatePairedDevice',
                          '00:AA', dbus.ObjectPath('/a'), '')
        self.assert_error('org.bluez.Error.InvalidArguments', self.adapter, ADAPTER, 'CreatePairedDevice',
                          SSP_DEVICE['address'], dbus.ObjectPath('/a'), 'Telepathy')
        far = AsyncCall(self.bus, self.adapter, ADAPTER, 'CreatePairedDevice', 'sos',
                        ['00:24:7E:11:22:33', self.agent.path, '']).wait()
        self.assertEqual(far.error.get_dbus_name(), 'org.bluez.Error.ConnectionAttemptFailed')
        self.assertEqual(far.error.get_dbus_message(), 'Page Timeout')
        self.assertEqual(AsyncCall(self.bus, self.adapter, ADAPTER, 'CreatePairedDevice', 'sos',
                                   ['00:1F:20:AB:CD:EF', self.agent.path, '']).wait().error.get_dbus_name(),
                         'org.bluez.Error.AlreadyExists')

    def test_register_agent(self):
        self.assertEqual(self.control('StartIncomingPairing', 'hci0', SSP_DEVICE['address']),
                         'org.bluez.Error.AgentNotAvailable')
        self.assert_error('org.bluez.Error.InvalidArguments', self.adapter, ADAPTER, 'RegisterAgent',
                          dbus.ObjectPath(self.agent.path), 'Nope')
        self.call(self.adapter, ADAPTER, 'RegisterAgent', dbus.ObjectPath(self.agent.path), 'DisplayYesNo')
        self.assert_error('org.bluez.Error.AlreadyExists', self.adapter, ADAPTER, 'RegisterAgent',
                          dbus.ObjectPath('/other'), '')
        self.assert_error('org.bluez.Error.DoesNotExist', self.adapter, ADAPTER, 'UnregisterAgent',
                          dbus.ObjectPath('/other'))
        self.call(self.adapter, ADAPTER, 'UnregisterAgent', dbus.ObjectPath(self.agent.path))
        self.assertTrue(self.run_until_agent('Release'))

    def test_incoming_pairing_and_authorize(self):
        self.call(self.adapter, ADAPTER, 'RegisterAgent', dbus.ObjectPath(self.agent.path), 'DisplayYesNo')
        incoming = AsyncCall(self.bus, '/org/btbus/Simulator', 'org.btbus.Simulator', 'StartIncomingPairing',
                             'ss', ['hci0', SSP_DEVICE['address']]).wait()
        self.assertEqual(incoming.result, 'accepted')
        self.assertEqual(self.agent.calls[0][0], 'RequestConfirmation')
        self.agent.answers['Authorize'] = rejected()
        auth = AsyncCall(self.bus, '/org/btbus/Simulator', 'org.btbus.Simulator', 'IncomingConnection',
                         'sss', ['hci0', SSP_DEVICE['address'], '1105']).wait()
        self.assertEqual(auth.result, 'org.bluez.Error.Rejected')
        self.assertEqual(self.agent.calls[-1],
                         ('Authorize', self.device_path(SSP_DEVICE['address']), '00001105-0000-1000-8000-00805f9b34fb'))
        self.assertEqual(self.control('IncomingConnection', 'hci0', '00:1F:20:AB:CD:EF', '1124'), 'trusted')

    def run_until_agent(self, member):
        return run_until(lambda: member in self.agent.members(), 5)


if __name__ == '__main__':
    unittest.main()
