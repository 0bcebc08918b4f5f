#!/usr/bin/python3
"""Writes the seed corpora of the fuzz targets into corpus/: messages in
D-Bus's wire form as BlueZ and its peers send them (and some they should not),
and texts as the library writes and reads them. Run it again after a change;
the files are committed."""

import os

from gi.repository import Gio, GLib

HERE = os.path.dirname(os.path.abspath(__file__))
V = GLib.Variant
ADAPTER, AGENT = '/org/bluez/1/hci0', '/org/bluez/agent_1'
DEVICE = ADAPTER + '/dev_00_11_22_33_44_55'
PROPERTIES = {'Address': V('s', '00:11:22:33:44:55'), 'Class': V('u', 7936), 'Paired': V('b', False),
              'UUIDs': V('as', ['0000110b-0000-1000-8000-00805f9b34fb']), 'RSSI': V('n', -60),
              'Vendor': V('q', 65535), 'Adapter': V('o', ADAPTER), 'Devices': V('ao', [DEVICE]),
              'Empty': V('ay', b'')}


def blob(message):
    message.set_serial(7)
    return message.to_blob(Gio.DBusCapabilityFlags.NONE)


def reply(body):
    call = Gio.DBusMessage.new_method_call('org.bluez', ADAPTER, 'org.bluez.Adapter', 'GetProperties')
    call.set_serial(6)
    answer = call.new_method_reply()
    answer.set_body(body)
    return blob(answer)


def signal(interface, member, body=None, path=ADAPTER):
    message = Gio.DBusMessage.new_signal(path, interface, member)
    if body is not None:
        message.set_body(body)
    return blob(message)


def request(member, body=None, interface='org.bluez.Agent'):
    message = Gio.DBusMessage.new_method_call(':1.1', AGENT, interface, member)
    if body is not None:
        message.set_body(body)
    return blob(message)


SEEDS = {
    'reply': [reply(V('(s)', ('hello',))), reply(V('(b)', (True,))), reply(V('(o)', (ADAPTER,))),
              reply(V('(as)', (['a', 'b'],))), reply(V('(ao)', ([ADAPTER, DEVICE],))),
              reply(V('(a{sv})', (PROPERTIES,))), reply(V('(a{ss})', ({'a': 'b'},))),
              reply(V('(a{uv})', ({1: V('s', 'x'), 2: V('u', 3)},))),
              reply(V('(a{sv})', ({'A': V('u', 1), '': V('u', 2)},))),
              reply(V('(a{sv})', ({'Level': V('d', 1.5), 'Nested': V('v', V('s', 'x'))},))),
              reply(V('(a{sv})', ({'Pair': V('(is)', (1, 'a')), 'Numbers': V('ai', [1])},))), reply(V('(i)', (5,)))],
    'signal': [signal('org.bluez.Adapter', 'PropertyChanged', V('(sv)', (name, value)))
               for name, value in PROPERTIES.items()] + [
        signal('org.bluez.Adapter', 'DeviceFound', V('(sa{sv})', ('00:11:22:33:44:55', PROPERTIES))),
        signal('org.bluez.Adapter', 'DeviceDisappeared', V('(s)', ('00:11:22:33:44:55',))),
        signal('org.bluez.Adapter', 'DeviceCreated', V('(o)', (DEVICE,))),
        signal('org.bluez.AudioSink', 'Connected', path=DEVICE),
        signal('org.bluez.Adapter', 'PropertyChanged', V('(us)', (1, 'Powered'))),
        signal('org.bluez.Adapter', 'PropertyChanged', V('(sv)', ('Level', V('d', 1.5)))),
        signal('org.bluez.Adapter', 'DeviceFound', V('(sv)', ('x', V('b', True)))),
        signal('org.bluez.Adapter', 'PropertyChanged')],
    'agent': [request('RequestPinCode', V('(o)', (DEVICE,))), request('RequestPasskey', V('(o)', (DEVICE,))),
              request('RequestConfirmation', V('(ou)', (DEVICE, 482913))),
              request('Authorize', V('(os)', (DEVICE, '0000110b-0000-1000-8000-00805f9b34fb'))),
              request('Cancel'), request('Release'), request('DisplayPasskey', V('(ou)', (DEVICE, 1))),
              request('ConfirmModeChange', V('(s)', ('off',))), request('RequestPinCode'),
              request('RequestConfirmation', V('(os)', (DEVICE, 'x'))),
              request('Release', interface='org.example.Other')],
    'device_found': [signal('org.bluez.Adapter', 'DeviceFound', V('(sa{sv})', (address, properties)))
                     for address, properties in (
                         ('00:11:22:33:44:55', PROPERTIES),
                         ('00:0D:3C:A1:B2:C3', {'Name': V('s', 'BT Headset'), 'RSSI': V('n', -52)}),
                         ('5C:F3:70:61:A0:17', {'Name': V('s', 'a;b: c'), ' Alias ': V('s', ' x ')}),
                         ('', {}))],
    'text_form': [b'Address: 00:11:22:33:44:55;Class: 7936;Paired: 0;', b'A: 1;;B:2;', b'x;y;', b'A: 1',
                  b'  Name  :  some value  ', b'A: 1,B: 2;', b'no colon', b'UUIDs: [a, b]\nRSSI: -60\n',
                  b':x;Name:;'],
    'auto_connect': [b'1,AA:BB:CC:DD:EE:01,AA:BB:CC:DD:EE:02', b'0', b'1', b'1,A,B,A', b' 1,x', b'12,AA',
                     b'-1,AA', b'1,', b'', b'99999999999999999999,A', b'0,AA:BB:CC:DD:EE:01'],
}

for target, seeds in SEEDS.items():
    directory = os.path.join(HERE, 'corpus', target)
    os.makedirs(directory, exist_ok=True)
    for index, seed in enumerate(seeds):
        with open(os.path.join(directory, f'seed-{index:02}'), 'wb') as f:
            f.write(bytes(seed))
