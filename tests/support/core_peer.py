'''A D-Bus peer for the client core's tests: methods that answer with crafted
replies, one-way methods whose arguments are kept, call-backs into the caller,
and crafted signals, well-formed and malformed.

Run with Debian's interpreter:
    /usr/bin/python3 -m dbusmock --session -t tests/support/core_peer.py
'''

import time

import dbus
import dbus.lowlevel
from gi.repository import GLib

BUS_NAME = 'org.btbus.TestPeer'
MAIN_OBJ = '/org/btbus/TestPeer'
MAIN_IFACE = 'org.btbus.TestPeer'
SYSTEM_BUS = False

CALLBACK_IFACE = 'org.btbus.Callback'
OTHER_PATH = '/org/btbus/Other'




def props(*pairs):
    return dbus.Dictionary(list(pairs), signature='sv')


REPLIES = {
    'String': ('s', lambda: dbus.String('hello')),
    'Bool': ('b', lambda: dbus.Boolean(True)),
    'Path': ('o', lambda: dbus.ObjectPath('/org/btbus/Thing')),
    'PathAsString': ('s', lambda: dbus.String('peer error text')),
    'Int': ('i', lambda: dbus.Int32(5)),
    'Strings': ('as', lambda: dbus.Array(['a', 'b', 'c'], signature='s')),
    'EmptyStrings': ('as', lambda: dbus.Array([], signature='s')),
    'Paths': ('ao', lambda: dbus.Array(['/a', '/b/c'], signature='o')),
    'EmptyPaths': ('ao', lambda: dbus.Array([], signature='o')),
    'Ints': ('ai', lambda: dbus.Array([1, 2], signature='i')),
    'Properties': ('a{sv}', lambda: props(
        ('Address', dbus.String('00:11:22:33:44:55', variant_level=1)),
        ('Class', dbus.UInt32(7936, variant_level=1)),
        ('Paired', dbus.Boolean(False, variant_level=1)),
        ('UUIDs', dbus.Array(['0000110b-0000-1000-8000-00805f9b34fb', 'x'], signature='s', variant_level=1)),
        ('RSSI', dbus.Int16(-60, variant_level=1)),
        ('Vendor', dbus.UInt16(65535, variant_level=1)),
        ('Adapter', dbus.ObjectPath('/org/bluez/1/hci0', variant_level=1)),
        ('Devices', dbus.Array(['/d/1', '/d/2'], signature='o', variant_level=1)),
        ('Empty', dbus.Array([], signature='y', variant_level=1)))),
    'PropertiesWithByte': ('a{sv}', lambda: props(
        ('Name', dbus.String('before', variant_level=1)), ('Bad', dbus.Byte(3, variant_level=1)), ('After', dbus.String('x', variant_level=1)))),
    'PropertiesWithDouble': ('a{sv}', lambda: props(('Level', dbus.Double(1.5, variant_level=1)))),
    'PropertiesWithInt32': ('a{sv}', lambda: props(('Level', dbus.Int32(-1, variant_level=1)))),
    'PropertiesWithNesting': ('a{sv}', lambda: props(
        ('Nested', dbus.String('x', variant_level=2)))),
    'PropertiesWithIntArray': ('a{sv}', lambda: props(('Numbers', dbus.Array([1], signature='i', variant_level=1)))),
    'PropertiesWithStruct': ('a{sv}', lambda: props(('Pair', dbus.Struct((1, 'a'), signature='is', variant_level=1)))),
    'PropertiesWithEmptyName': ('a{sv}', lambda: props(
        ('A', dbus.UInt32(1, variant_level=1)), ('B', dbus.UInt32(2, variant_level=1)), ('', dbus.UInt32(3, variant_level=1)),
        ('C', dbus.UInt32(4, variant_level=1)))),
    'PropertiesWithUintKeys': ('a{uv}', lambda: dbus.Dictionary(
        [(dbus.UInt32(1), dbus.String('one', variant_level=1)), (dbus.UInt32(2), dbus.UInt32(2, variant_level=1))],
        signature='uv')),
    'PropertiesWithByteKeys': ('a{yv}', lambda: dbus.Dictionary(
        [(dbus.Byte(1), dbus.String('one', variant_level=1))], signature='yv')),
    'Services': ('a{us}', lambda: dbus.Dictionary(
        [(dbus.UInt32(0x10001), '<record/>'), (dbus.UInt32(0x10002), '<record id="2"/>')],
        signature='us')),
    'StringPairs': ('a{ss}', lambda: dbus.Dictionary([('a', '1'), ('b', '2')], signature='ss')),
    'Huge': ('a{sv}', lambda: props(*[('k%d' % i, dbus.UInt32(i, variant_level=1)) for i in range(100000)])),
    'HugeStrings': ('as', lambda: dbus.Array(['s%d' % i for i in range(100000)], signature='s')),
}


# kind: (path, interface, member, signature, arguments)
SIGNALS = {
    'path': (MAIN_OBJ, MAIN_IFACE, 'PathSignal', 'o', ['/org/btbus/Thing']),
    'string': (MAIN_OBJ, MAIN_IFACE, 'StringSignal', 's', ['text']),
    'sentinel': (MAIN_OBJ, MAIN_IFACE, 'Sentinel', 's', ['done']),
    'variant': (MAIN_OBJ, MAIN_IFACE, 'PropertyChanged', 'sv', ['Powered', dbus.Boolean(True, variant_level=1)]),
    'variant-other-path': (OTHER_PATH, MAIN_IFACE, 'PropertyChanged', 'sv',
                           ['Alias', dbus.String('other', variant_level=1)]),
    'dict': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sa{sv}',
             ['00:11:22:33:44:55', props(('Class', dbus.UInt32(7936, variant_level=1)), ('RSSI', dbus.Int16(-5, variant_level=1)))]),
    'none': (MAIN_OBJ, MAIN_IFACE, 'Bare', '', []),
    'variant-double': (MAIN_OBJ, MAIN_IFACE, 'PropertyChanged', 'sv', ['Level', dbus.Double(1.5, variant_level=1)]),
    'variant-missing': (MAIN_OBJ, MAIN_IFACE, 'PropertyChanged', 's', ['Level']),
    'variant-nested': (MAIN_OBJ, MAIN_IFACE, 'PropertyChanged', 'sv',
                       ['Level', dbus.Array([props(('a', dbus.Byte(1, variant_level=1)))], signature='a{sv}',
                                            variant_level=1)]),
    'variant-noargs': (MAIN_OBJ, MAIN_IFACE, 'PropertyChanged', '', []),
    'variant-int': (MAIN_OBJ, MAIN_IFACE, 'PropertyChanged', 'iv', [5, dbus.UInt32(1, variant_level=1)]),
    'string-noargs': (MAIN_OBJ, MAIN_IFACE, 'StringSignal', '', []),
    'string-int': (MAIN_OBJ, MAIN_IFACE, 'StringSignal', 'i', [7]),
    'path-string': (MAIN_OBJ, MAIN_IFACE, 'PathSignal', 's', ['/not/a/path/argument']),
    'path-noargs': (MAIN_OBJ, MAIN_IFACE, 'PathSignal', '', []),
    'dict-notdict': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sas', ['00:11', ['a']]),
    'dict-nosecond': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 's', ['00:11']),
    'dict-int': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'ia{sv}', [1, props()]),
    'dict-byte': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sa{sv}',
                  ['00:11', props(('Name', dbus.String('n', variant_level=1)), ('Bad', dbus.Byte(1, variant_level=1)))]),
    'dict-bytekeys': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sa{yv}',
                      ['00:11', dbus.Dictionary([(dbus.Byte(1), dbus.String('x', variant_level=1))], signature='yv')]),
    'dict-emptyname': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sa{sv}',
                       ['00:11', props(('A', dbus.UInt32(1, variant_level=1)), ('', dbus.UInt32(2, variant_level=1)),
                                       ('B', dbus.UInt32(3, variant_level=1)))]),
    'dict-empty': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sa{sv}', ['00:11', props()]),
    'dict-huge': (MAIN_OBJ, MAIN_IFACE, 'DictSignal', 'sa{sv}',
                  ['00:11', props(*[('k%d' % i, dbus.String('x' * 10, variant_level=1)) for i in range(50000)])]),
}


def emit(connection, path, interface, member, signature, arguments):
    message = dbus.lowlevel.SignalMessage(path, interface, member)
    if signature:
        message.append(signature=signature, *arguments)
    connection.send_message(message)


TAGS = [(dbus.Boolean, 'b'), (dbus.Byte, 'y'), (dbus.Int16, 'n'), (dbus.UInt16, 'q'),
        (dbus.Int32, 'i'), (dbus.UInt32, 'u'), (dbus.Double, 'd'), (dbus.ObjectPath, 'o'),
        (dbus.String, 's')]


def describe(value):
    '''type-tagged text of a received argument, e.g. u:5, b:true or v(q:5)'''
    tag = next((t for kind, t in TAGS if isinstance(value, kind)), None)
    if tag is None:
        text = repr(value)
    else:
        text = '%s:%s' % (tag, ('true' if value else 'false') if tag == 'b' else value)
    return 'v(%s)' % text if getattr(value, 'variant_level', 0) else text


def load(mock, parameters):
    mock.ticks = 0
    mock.ticker = None
    mock.recorded = []

    for name, (signature, make) in REPLIES.items():
        mock.AddMethod(MAIN_IFACE, name, '', signature, lambda self, make=make: make())

    mock.AddMethod(MAIN_IFACE, 'Nothing', '', '', lambda self: None)
    mock.AddMethod(MAIN_IFACE, 'Fail', '', '', fail)
    mock.AddMethod(MAIN_IFACE, 'Sleep', 'u', 's', sleep)
    mock.AddMethod(MAIN_IFACE, 'Echo', 's', 's', lambda self, text: text)
    for name, signature in [('RecordString', 's'), ('RecordScalars', 'bsouq'), ('RecordVariant', 'v'),
                            ('RecordProperty', 'sv')]:
        mock.AddMethod(MAIN_IFACE, name, signature, '', record(name))
    mock.AddMethod(MAIN_IFACE, 'Recorded', '', 'as', lambda self: dbus.Array(self.recorded, signature='s'))
    mock.AddMethod(MAIN_IFACE, 'ClearRecorded', '', '', clear_recorded)
    mock.AddMethod(MAIN_IFACE, 'CallBack', 'so', 's', call_back)
    mock.AddMethod(MAIN_IFACE, 'Emit', 's', '', emit_kind)
    mock.AddMethod(MAIN_IFACE, 'StartTicking', 'u', '', start_ticking)
    mock.AddMethod(MAIN_IFACE, 'StopTicking', '', 's', stop_ticking)


def fail(self):
    raise dbus.exceptions.DBusException('peer says no', name='org.btbus.Error.Failed')


def sleep(self, milliseconds):
    time.sleep(milliseconds / 1000.0)
    return 'slept'


def record(name):
    def method(self, *arguments):
        self.recorded.append('%s(%s)' % (name, ', '.join(describe(a) for a in arguments)))
    return method


def clear_recorded(self):
    self.recorded = []


def callback_proxy(self, name, path):
    return dbus.SessionBus().get_object(name, path, introspect=False)


def call_back(self, name, path):
    '''Calls the caller back before answering: the caller must dispatch while it waits.'''
    answer = callback_proxy(self, name, path).Ping('ping', dbus_interface=CALLBACK_IFACE, timeout=10)
    return 'called back: ' + answer


def emit_kind(self, kind):
    if kind not in SIGNALS:
        raise dbus.exceptions.DBusException('no signal kind ' + kind, name='org.btbus.Error.Invalid')
    emit(dbus.SessionBus(), *SIGNALS[kind])


def start_ticking(self, interval_ms):
    self.ticks = 0

    def tick():
        self.ticks += 1
        emit(dbus.SessionBus(), MAIN_OBJ, MAIN_IFACE, 'Tick', 's', [str(self.ticks)])
        return True

    self.ticker = GLib.timeout_add(max(1, interval_ms), tick)


def stop_ticking(self):
    if self.ticker is not None:
        GLib.source_remove(self.ticker)
        self.ticker = None
    return str(self.ticks)
