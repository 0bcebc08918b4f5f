#!/usr/bin/python3
"""Writes the fuzz targets' seed corpora into corpus/, to be committed: messages in D-Bus's wire form
as BlueZ and its peers send them (and some they should not), and texts as the library writes them."""

import os

from gi.repository import Gio, GLib

V = GLib.Variant
ADAPTER, AGENT, ADDRESS = '/org/bluez/1/hci0', '/org/bluez/agent_1', '00:11:22:33:44:55'
DEVICE, A2DP = ADAPTER + '/dev_00_11_22_33_44_55', '0000110b-0000-1000-8000-00805f9b34fb'
PROPERTIES = {'Address': V('s', ADDRESS), 'Class': V('u', 7936), 'Paired': V('b', False),
              'UUIDs': V('as', [A2DP]), 'RSSI': V('n', -60), 'Vendor': V('q', 65535),
              'Adapter': V('o', ADAPTER), 'Devices': V('ao', [DEVICE]), 'Empty': V('ay', b'')}


def blob(message, body=None):
    if body is not None:
        message.set_body(body)
    message.set_serial(7)
    return message.to_blob(Gio.DBusCapabilityFlags.NONE)


def reply(signature, value):
    call = Gio.DBusMessage.new_method_call('org.bluez', ADAPTER, 'org.bluez.Adapter', 'GetProperties')
    call.set_serial(6)
    return blob(call.new_method_reply(), V(signature, (value,)))


def signal(member, body=None, interface='org.bluez.Adapter', path=ADAPTER):
    return blob(Gio.DBusMessage.new_signal(path, interface, member), body)


def request(member, body=None, interface='org.bluez.Agent'):
    return blob(Gio.DBusMessage.new_method_call(':1.1', AGENT, interface, member), body)


SEEDS = {
    'reply': [reply('(s)', 'hello'), reply('(b)', True), reply('(o)', ADAPTER), reply('(as)', ['a', 'b']),
              reply('(ao)', [ADAPTER, DEVICE]), reply('(a{sv})', PROPERTIES), reply('(a{ss})', {'a': 'b'}),
              reply('(a{uv})', {1: V('s', 'x'), 2: V('u', 3)}), reply('(a{sv})', {'A': V('u', 1), '': V('u', 2)}),
              reply('(a{sv})', {'Level': V('d', 1.5), 'Nested': V('v', V('s', 'x'))}),
              reply('(a{sv})', {'Pair': V('(is)', (1, 'a')), 'Numbers': V('ai', [1])}), reply('(i)', 5)],
    'signal': [signal('PropertyChanged', V('(sv)', item)) for item in PROPERTIES.items()] + [
        signal('DeviceFound', V('(sa{sv})', (ADDRESS, PROPERTIES))),
        signal('DeviceDisappeared', V('(s)', (ADDRESS,))), signal('DeviceCreated', V('(o)', (DEVICE,))),
        signal('Connected', interface='org.bluez.AudioSink', path=DEVICE),
        signal('PropertyChanged', V('(us)', (1, 'Powered'))),
        signal('PropertyChanged', V('(sv)', ('Level', V('d', 1.5)))),
        signal('DeviceFound', V('(sv)', ('x', V('b', True)))), signal('PropertyChanged')],
    'agent': [request('RequestPinCode', V('(o)', (DEVICE,))), request('RequestPasskey', V('(o)', (DEVICE,))),
              request('RequestConfirmation', V('(ou)', (DEVICE, 482913))),
              request('Authorize', V('(os)', (DEVICE, A2DP))), request('Cancel'), request('Release'),
              request('DisplayPasskey', V('(ou)', (DEVICE, 1))), request('ConfirmModeChange', V('(s)', ('off',))),
              request('RequestPinCode'), request('RequestConfirmation', V('(os)', (DEVICE, 'x'))),
              request('Release', interface='org.example.Other')],
    'device_found': [signal('DeviceFound', V('(sa{sv})', found)) for found in (
        (ADDRESS, PROPERTIES), ('00:0D:3C:A1:B2:C3', {'Name': V('s', 'BT Headset'), 'RSSI': V('n', -52)}),
        ('5C:F3:70:61:A0:17', {'Name': V('s', 'a;b: c'), ' Alias ': V('s', ' x ')}), ('', {}))],
    # Texts of a single entry, of entries closed or not, and of whitespace of every kind.
    'text_form': [b'Address: 00:11:22:33:44:55;Class: 7936;Paired: 0;', b'A: 1;;B:2;', b'x;y;', b'A: 1',
                  b'  Name  :  some value  ', b'A: 1,B: 2;', b'no colon', b'UUIDs: [a, b]\nRSSI: -60\n',
                  b':x;Name:;', b'\t\r\v\fClass:\n7936 \n', b'', b'A: 1;B: 2', b'junk;A: 1,B: 2;',
                  b'Name: a;b;Alias: c;D: e;'],
    'auto_connect': [b'1,AA:BB:CC:DD:EE:01,AA:BB:CC:DD:EE:02', b'0', b'1', b'1,A,B,A', b' 1,x', b'12,AA',
                     b'-1,AA', b'1,', b'', b'99999999999999999999,A', b'0,AA:BB:CC:DD:EE:01'],
}

for target, seeds in SEEDS.items():
    directory = os.path.join(os.path.dirname(os.path.abspath(__file__)), 'corpus', target)
    os.makedirs(directory, exist_ok=True)
    for index, seed in enumerate(seeds):
        with open(os.path.join(directory, f'seed-{index:02}'), 'wb') as f:
            f.write(bytes(seed))
