'''The client core's test peer: replies and signals of any shape, given as JSON
with their signature as the simulator takes them (a variant is [signature,
value]), call-backs and late replies. Run by the tests with Debian's python3:
    /usr/bin/python3 -m dbusmock --session -t tests/support/core_peer.py
'''

import json
import os
import sys

import dbus
import dbus.lowlevel
from gi.repository import GLib

sys.path.insert(0, os.path.join(os.path.dirname(__file__), '..', '..', 'tools', 'bluez4-sim'))
from bluez4sim.values import args_to_dbus, to_dbus  # noqa: E402

BUS_NAME = MAIN_IFACE = 'org.btbus.TestPeer'
MAIN_OBJ = '/org/btbus/TestPeer'


def load(mock, parameters):
    mock.ticks, mock.ticker = 0, None
    mock.AddMethods(MAIN_IFACE, [
        ('Nothing', '', '', lambda self: None), ('Fail', '', '', fail), ('Echo', 's', 's', lambda self, text: text),
        ('Describe', 'bsouqv', 's', lambda self, *arguments: ', '.join(repr(a) for a in arguments)),
        ('CallBack', 'so', 's', call_back),
        ('StartTicking', 'u', '', start_ticking), ('StopTicking', '', 's', stop_ticking)])


@dbus.service.method(MAIN_IFACE, in_signature='ss')
def Reply(self, signature, value):
    '''Answers with value, of type signature.'''
    return to_dbus(signature, json.loads(value))


@dbus.service.method(MAIN_IFACE, in_signature='osss')
def Emit(self, path, member, signature, arguments):
    '''Sends member of this interface from path, with arguments of types signature.'''
    message = dbus.lowlevel.SignalMessage(path, MAIN_IFACE, member)
    if signature:
        message.append(signature=signature, *args_to_dbus(signature, json.loads(arguments)))
    dbus.SessionBus().send_message(message)


@dbus.service.method(MAIN_IFACE, in_signature='u', out_signature='s', async_callbacks=('reply', 'error'))
def Later(self, milliseconds, reply, error):
    '''Answers after milliseconds, with their number, and answers other calls meanwhile.'''
    GLib.timeout_add(milliseconds, lambda: reply(str(milliseconds)))


def fail(self):
    raise dbus.exceptions.DBusException('peer says no', name='org.btbus.Error.Failed')


def call_back(self, name, path):
    '''Calls the caller back before answering: the caller must dispatch while it waits.'''
    caller = dbus.SessionBus().get_object(name, path, introspect=False)
    return 'called back: ' + caller.Ping('ping', dbus_interface='org.btbus.Callback', timeout=10)


def start_ticking(self, interval_ms):
    self.ticks = 0

    def tick():
        self.ticks += 1
        Emit(self, MAIN_OBJ, 'Tick', 's', '["%d"]' % self.ticks)
        return True

    self.ticker = GLib.timeout_add(max(1, interval_ms), tick)


def stop_ticking(self):
    if self.ticker is not None:
        GLib.source_remove(self.ticker)
        self.ticker = None
    return str(self.ticks)
