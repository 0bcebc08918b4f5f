"""Live state of the simulated bluetoothd: simulator, adapters, devices, pairing.

The simulator never blocks: agent calls are asynchronous, delays are GLib
timers, and a method whose answer depends on one of them replies later
through its `Call`.
"""

import sys
import traceback

import dbus
import dbus.lowlevel
from dbusmock import mockobject
from gi.repository import GLib

from . import scene as sc
from .values import format_args, props_dict, variant

BLUEZ = 'org.bluez'
MANAGER = 'org.bluez.Manager'
ADAPTER = 'org.bluez.Adapter'
DEVICE = 'org.bluez.Device'
AUDIO = 'org.bluez.Audio'
AUDIO_SINK = 'org.bluez.AudioSink'
CONTROL = 'org.bluez.Control'
AGENT = 'org.bluez.Agent'
AGENT_TIMEOUT = 60

PENDING = object()  # a handler's answer when it replies later through its Call

ERROR_MESSAGES = {
    'InvalidArguments': 'Invalid arguments in method call',
    'InProgress': 'In Progress',
    'AlreadyExists': 'Already Exists',
    'NotSupported': 'Operation is not supported',
    'NotConnected': 'Not Connected',
    'AlreadyConnected': 'Already Connected',
    'DoesNotExist': 'Does Not Exist',
    'NotAuthorized': 'Operation Not Authorized',
    'NoSuchAdapter': 'No such adapter',
    'AgentNotAvailable': 'Agent Not Available',
    'NotReady': 'Resource Not Ready',
    'NotAvailable': 'Operation currently not available',
    'ConnectionAttemptFailed': 'Page Timeout',
    'AuthenticationFailed': 'Authentication Failed',
    'AuthenticationRejected': 'Authentication Rejected',
    'AuthenticationCanceled': 'Authentication Canceled',
    'AuthenticationTimeout': 'Authentication Timeout',
    'Failed': 'Failed',
}

# Signals per interface with bluetoothd's argument names, for introspection.
_PROPERTY_CHANGED = ('PropertyChanged', 'sv', ['name', 'value'])
SIGNALS = {
    MANAGER: [_PROPERTY_CHANGED, ('AdapterAdded', 'o', ['adapter']), ('AdapterRemoved', 'o', ['adapter']),
              ('DefaultAdapterChanged', 'o', ['adapter'])],
    ADAPTER: [_PROPERTY_CHANGED, ('DeviceCreated', 'o', ['device']), ('DeviceRemoved', 'o', ['device']),
              ('DeviceFound', 'sa{sv}', ['address', 'values']), ('DeviceDisappeared', 's', ['address'])],
    DEVICE: [_PROPERTY_CHANGED, ('DisconnectRequested', '', [])],
    AUDIO: [_PROPERTY_CHANGED],
    AUDIO_SINK: [_PROPERTY_CHANGED, ('Connected', '', []), ('Disconnected', '', []), ('Playing', '', []),
                 ('Stopped', '', [])],
    CONTROL: [_PROPERTY_CHANGED, ('Connected', '', []), ('Disconnected', '', [])],
}

# Agent request made for a pairing: local capability -> remote IO capability -> method.
SSP_METHOD = {
    'DisplayOnly': {'KeyboardOnly': 'DisplayPasskey', 'KeyboardDisplay': 'DisplayPasskey'},
    'DisplayYesNo': {'DisplayOnly': 'RequestConfirmation', 'DisplayYesNo': 'RequestConfirmation',
                     'KeyboardOnly': 'DisplayPasskey', 'KeyboardDisplay': 'RequestConfirmation'},
    'KeyboardOnly': {'DisplayOnly': 'RequestPasskey', 'DisplayYesNo': 'RequestPasskey',
                     'KeyboardOnly': 'RequestPasskey', 'KeyboardDisplay': 'RequestPasskey'},
    'NoInputNoOutput': {},
    'KeyboardDisplay': {'DisplayOnly': 'RequestPasskey', 'DisplayYesNo': 'RequestConfirmation',
                        'KeyboardOnly': 'DisplayPasskey', 'KeyboardDisplay': 'RequestConfirmation'},
}
# Agent errors after which bluetoothd retries a request on the adapter-wide agent.
RETRY_ON_ADAPTER_AGENT = ('org.freedesktop.DBus.Error.UnknownMethod', 'org.freedesktop.DBus.Error.NoReply')


def bluez_error(name, message=None):
    return dbus.DBusException(message or ERROR_MESSAGES.get(name, name), name='org.bluez.Error.' + name)


def check_address(address):
    if not sc.valid_address(address):
        raise bluez_error('InvalidArguments')
    return address.upper()


class Call:
    """One incoming method call; replies at most once, now or later."""

    def __init__(self, sim, path, out_sig, sender, reply, error):
        self.sim, self.path, self.out_sig, self.sender = sim, path, out_sig, sender
        self._reply, self._error = reply, error
        self.done = False
        self.reset_value = None  # what a control call answers when Reset interrupts it

    def ret(self, value=None):
        if not self.done:
            self.done = True
            self.sim.pending.discard(self)
            if self.out_sig:
                self._reply(value)
            else:
                self._reply()

    def fail(self, exc):
        if not self.done:
            self.done = True
            self.sim.pending.discard(self)
            self._error(exc)

    def abort(self):
        """Answer a call still waiting when the scene is reset."""
        if self.reset_value is not None:
            self.ret(self.reset_value)
        else:
            self.fail(bluez_error('Failed', 'Canceled'))


class Agent:
    """An agent: the client's unique bus name, its object path and capability."""

    def __init__(self, name, path, capability):
        self.name, self.path, self.capability = str(name), str(path), capability

    def same(self, other):
        return other is not None and (self.name, self.path) == (other.name, other.path)


class LogEntry:
    def __init__(self, text, answer=None):
        self.text, self.answer = text, answer

    def render(self):
        return self.text if self.answer is None else f'{self.text} -> {self.answer}'


class AgentRequest:
    """An agent call awaiting its answer; `abandon` makes the answer go unheard."""

    def __init__(self, sim, agent, on_answer):
        self.sim, self.agent, self.on_answer = sim, agent, on_answer
        self.generation = sim.generation
        self.outstanding = True

    def answered(self, value, error):
        if self.outstanding and self.generation == self.sim.generation:
            self.outstanding = False
            self.on_answer(value, error)

    def abandon(self):
        self.outstanding = False


class Simulator:
    """The whole simulated daemon: adapters, call log, timers and bus plumbing."""

    def __init__(self, mock, scene, options):
        self.mock = mock
        self.conn = mock.connection
        self.scene = scene
        self.options = options
        self.base = f'/org/bluez/{mock_pid()}'
        self.adapters = {}  # name -> Adapter, in order of arrival
        self.default = None
        self.call_log = []
        self.pending = set()
        self.timers = set()
        self.generation = 0
        self._watch = self.conn.add_signal_receiver(
            self._name_owner_changed, signal_name='NameOwnerChanged',
            dbus_interface='org.freedesktop.DBus', bus_name='org.freedesktop.DBus',
            path='/org/freedesktop/DBus')
        self.build()

    # --- scene -------------------------------------------------------------

    def build(self):
        """Create the starting scene's objects, silently."""
        for info in self.scene:
            self.install_adapter(info)
        self.default = next(iter(self.adapters), None)

    def install_adapter(self, info):
        """Export an adapter and the device objects it starts with."""
        from .interfaces import AdapterInterface
        adapter = Adapter(self, info)
        self.adapters[info.name] = adapter
        self.export(adapter.path, ADAPTER, AdapterInterface(adapter))
        for dev in adapter.devices.values():
            if dev.info.created:
                dev.export_object(temporary=False)
        return adapter

    def reset(self, scene=None):
        """Back to the starting scene without emitting anything."""
        self.generation += 1
        for call in list(self.pending):
            call.abort()
        for tid in list(self.timers):
            self.cancel(tid)
        for adapter in list(self.adapters.values()):
            adapter.unexport_all()
        self.adapters.clear()
        self.call_log = []
        if scene is not None:
            self.scene = scene
        self.build()

    def shutdown(self):
        """Stop timers and signal watches (when dbusmock reloads the template)."""
        self.generation += 1
        for call in list(self.pending):
            call.abort()
        for tid in list(self.timers):
            self.cancel(tid)
        self._watch.remove()

    # --- bus plumbing ------------------------------------------------------

    def export(self, path, iface, impl, logged=True):
        """Put an interface implementation on the dbusmock object at `path`."""
        if path != self.mock.path and path not in mockobject.objects:
            self.mock.AddObject(path, iface, {}, [])
        obj = self.mock if path == self.mock.path else mockobject.objects[path]
        table = obj.methods.setdefault(iface, {})
        for member, in_sig, out_sig in impl.METHODS:
            table[member] = (in_sig, out_sig, '', self._dbus_entry(iface, member, in_sig, out_sig,
                                                                   getattr(impl, member), logged))
        for member, sig, names in SIGNALS.get(iface, ()):
            table.setdefault(member, (sig, '', '', _signal_entry(iface, member, sig, names)))

    def unexport_interface(self, path, iface):
        if path in mockobject.objects:
            mockobject.objects[path].methods.pop(iface, None)

    def unexport(self, path):
        if path in mockobject.objects and path != self.mock.path:
            self.mock.RemoveObject(path)

    def _dbus_entry(self, iface, member, in_sig, out_sig, handler, logged):
        """A dbus-python method entry that checks the signature and logs the call."""
        sim = self

        def entry(_obj, *args, _message=None, _reply=None, _error=None):
            path = _message.get_path()
            if (_message.get_signature() or '') != in_sig:
                _error(_unknown_method(iface, member, _message))
                return
            if logged:
                sim.log(f'{path} {iface}.{member}({format_args(args)})')
            call = Call(sim, path, out_sig, _message.get_sender(), _reply, _error)
            try:
                result = handler(call, *args)
            except dbus.DBusException as e:
                call.fail(e)
                return
            except Exception as e:  # a simulator bug: report it instead of hanging the client
                traceback.print_exc(file=sys.stderr)
                call.fail(dbus.DBusException(f'simulator error: {e}', name='org.bluez.Error.Failed'))
                return
            if result is PENDING:
                if not call.done:
                    sim.pending.add(call)
            else:
                call.ret(result)

        return _callable_entry(entry, iface, member, in_sig, out_sig)

    def emit(self, path, iface, member, sig='', *args):
        msg = dbus.lowlevel.SignalMessage(path, iface, member)
        if sig:
            msg.append(*args, signature=sig)
        self.conn.send_message(msg)

    def emit_property(self, path, iface, name, sig, value):
        self.emit(path, iface, 'PropertyChanged', 'sv', name, variant(sig, value))

    # --- agents ------------------------------------------------------------

    def call_agent(self, agent, member, sig, args, on_answer):
        """Call an agent method without waiting; on_answer(value, error_name) later."""
        entry = self.log(f'agent {agent.name} {agent.path} {AGENT}.{member}({format_args(args)})', 'pending')
        request = AgentRequest(self, agent, on_answer)

        def reply(*values):
            entry.answer = format_args(values)
            request.answered(values[0] if values else None, None)

        def error(e):
            name = e.get_dbus_name() or 'org.freedesktop.DBus.Error.Failed'
            entry.answer = 'error ' + name
            request.answered(None, name)

        self.conn.call_async(agent.name, agent.path, AGENT, member, sig, args, reply, error,
                             timeout=AGENT_TIMEOUT)
        return request

    def send_agent(self, agent, member, sig='', args=()):
        """Send an agent call whose answer nobody waits for (Release, Cancel, DisplayPasskey)."""
        msg = dbus.lowlevel.MethodCallMessage(agent.name, agent.path, AGENT, member)
        if sig:
            msg.append(*args, signature=sig)
        self.conn.send_message(msg)
        self.log(f'agent {agent.name} {agent.path} {AGENT}.{member}({format_args(args)})', 'sent')

    def log(self, text, answer=None):
        entry = LogEntry(text, answer)
        self.call_log.append(entry)
        return entry

    # --- timers ------------------------------------------------------------

    def later(self, seconds, fn, *args):
        """Run fn after `seconds` (0: once idle); Reset cancels it."""
        holder = []

        def fire():
            self.timers.discard(holder[0])
            fn(*args)
            return False

        tid = GLib.timeout_add(max(0, int(seconds * 1000)), fire)
        holder.append(tid)
        self.timers.add(tid)
        return tid

    def cancel(self, tid):
        if tid in self.timers:
            self.timers.discard(tid)
            GLib.source_remove(tid)
        return None

    # --- adapters ----------------------------------------------------------

    def adapter(self, name):
        try:
            return self.adapters[name]
        except KeyError as e:
            raise bluez_error('NoSuchAdapter') from e

    def adapter_paths(self):
        return [a.path for a in self.adapters.values()]

    def add_adapter(self, info):
        if info.name in self.adapters:
            raise bluez_error('AlreadyExists')
        adapter = self.install_adapter(info)
        self.emit('/', MANAGER, 'AdapterAdded', 'o', adapter.path)
        self.emit_property('/', MANAGER, 'Adapters', 'ao', self.adapter_paths())
        if self.default is None:
            self.default = info.name
            self.emit('/', MANAGER, 'DefaultAdapterChanged', 'o', adapter.path)
        return adapter.path

    def remove_adapter(self, name):
        adapter = self.adapter(name)
        adapter.shut_down()
        del self.adapters[name]
        adapter.unexport_all()
        self.emit_property('/', MANAGER, 'Adapters', 'ao', self.adapter_paths())
        if self.default == name:
            self.default = next(iter(self.adapters), None)
            if self.default is not None:
                self.emit('/', MANAGER, 'DefaultAdapterChanged', 'o', self.adapters[self.default].path)
        self.emit('/', MANAGER, 'AdapterRemoved', 'o', adapter.path)

    def _name_owner_changed(self, name, old_owner, new_owner):
        if name.startswith(':') and not new_owner:
            for adapter in list(self.adapters.values()):
                adapter.client_gone(name)


def _unknown_method(iface, member, message):
    return dbus.DBusException(
        f'Method "{member}" with signature "{message.get_signature() or ""}" on '
        f'interface "{iface}" doesn\'t exist\n', name='org.freedesktop.DBus.Error.UnknownMethod')


def _callable_entry(entry, iface, member, in_sig, out_sig):
    """Give `entry` the attributes dbus-python reads to call it and to introspect it."""
    entry.__name__ = member
    entry._dbus_is_method = True
    entry._dbus_is_signal = False
    entry._dbus_interface = iface
    entry._dbus_in_signature = in_sig
    entry._dbus_out_signature = out_sig
    entry._dbus_async_callbacks = ('_reply', '_error')
    entry._dbus_message_keyword = '_message'
    for kw in ('sender', 'path', 'rel_path', 'destination', 'connection'):
        setattr(entry, f'_dbus_{kw}_keyword', None)
    entry._dbus_args = [f'arg{i}' for i in range(len(dbus.Signature(in_sig)))]
    entry._dbus_get_args_options = {'byte_arrays': False}
    return entry


def _signal_entry(iface, member, sig, names):
    """A signal declaration in the object's table: introspected as a signal, and
    called as a method (which bluetoothd does not offer) it answers UnknownMethod."""
    def entry(_obj, *_args, _message=None, _reply=None, _error=None):
        _error(_unknown_method(iface, member, _message))

    entry = _callable_entry(entry, iface, member, sig, '')
    entry._dbus_is_method = False
    entry._dbus_is_signal = True
    entry._dbus_signature = sig
    entry._dbus_args = names
    return entry


def mock_pid():
    import os
    return os.getpid()


class Adapter:
    """One local adapter and its neighbourhood of remote devices."""

    def __init__(self, sim, info):
        self.sim = sim
        self.name = info.name
        self.path = f'{sim.base}/{info.name}'
        self.address = info.address
        self.alias = info.alias
        self.cls = info.cls
        self.powered = info.powered
        self.discoverable_setting = info.discoverable
        self.pairable_setting = info.pairable
        self.discoverable_timeout = info.discoverable_timeout
        self.pairable_timeout = info.pairable_timeout
        self.uuids = sorted(sc.normalize_uuid(u) for u in ('1200', '110a', '110c', '1112', '111f'))
        self.devices = {d.address: Device(self, d) for d in info.devices}
        self.agent = None
        self.discovery = {}  # sender -> session count
        self.discovering = False
        self.found_now, self.found_before = set(), None
        self.round_timer = None
        self.sessions = {}  # RequestSession: sender -> count
        self.global_powered = self.powered
        self.mode_timers = {}

    # --- properties --------------------------------------------------------

    @property
    def discoverable(self):
        return self.powered and self.discoverable_setting

    @property
    def pairable(self):
        return self.powered and self.pairable_setting

    def object_paths(self):
        return [d.path for d in self.devices.values() if d.exported]

    def properties(self):
        return props_dict([
            ('Address', 's', self.address), ('Name', 's', self.alias), ('Class', 'u', self.cls),
            ('Powered', 'b', self.powered), ('Discoverable', 'b', self.discoverable),
            ('Pairable', 'b', self.pairable), ('DiscoverableTimeout', 'u', self.discoverable_timeout),
            ('PairableTimeout', 'u', self.pairable_timeout), ('Discovering', 'b', self.discovering),
            ('Devices', 'ao', self.object_paths()), ('UUIDs', 'as', self.uuids)])

    def changed(self, name, sig, value):
        self.sim.emit_property(self.path, ADAPTER, name, sig, value)

    def devices_changed(self):
        self.changed('Devices', 'ao', self.object_paths())

    def neighbour(self, address):
        """The device at `address`; an unknown address is an unreachable device."""
        if address not in self.devices:
            self.devices[address] = Device(self, sc.DeviceInfo({'address': address, 'in_range': False}))
        return self.devices[address]

    def find(self, address):
        dev = self.devices.get(address.upper()) if sc.valid_address(address) else None
        if dev is None:
            raise bluez_error('DoesNotExist')
        return dev

    def by_path(self, path):
        for dev in self.devices.values():
            if dev.exported and dev.path == path:
                return dev
        return None

    # --- power and modes ---------------------------------------------------

    def set_powered(self, on, by_user=True):
        if by_user:
            self.global_powered = on
        if on == self.powered:
            return
        if on:
            self.powered = True
            self.changed('Powered', 'b', True)
            if self.discoverable_setting:
                self.changed('Discoverable', 'b', True)
                self._start_mode_timer('Discoverable')
            if self.pairable_setting:
                self.changed('Pairable', 'b', True)
                self._start_mode_timer('Pairable')
            return
        if self.discoverable_setting:
            self.changed('Discoverable', 'b', False)
        if self.pairable_setting:
            self.changed('Pairable', 'b', False)
        for tid in self.mode_timers.values():
            self.sim.cancel(tid)
        self.mode_timers.clear()
        self.discovery.clear()
        self.stop_discovery()
        self.powered = False
        self.changed('Powered', 'b', False)
        self.sessions.clear()
        for dev in list(self.devices.values()):
            if dev.pairing:
                dev.pairing.cancel()
            dev.link_down()

    def set_discoverable(self, on):
        if not self.powered:
            self.discoverable_setting = on
            if on:
                self.set_powered(True)
            return
        if on != self.discoverable_setting:
            self.discoverable_setting = on
            self.changed('Discoverable', 'b', on)
            self._start_mode_timer('Discoverable')

    def set_pairable(self, on):
        if not self.powered:
            raise bluez_error('NotReady')
        if on != self.pairable_setting:
            self.pairable_setting = on
            self.changed('Pairable', 'b', on)
            self._start_mode_timer('Pairable')

    def set_mode_timeout(self, mode, seconds):
        attr = mode.lower() + '_timeout'
        if getattr(self, attr) != seconds:
            setattr(self, attr, seconds)
            self.changed(mode + 'Timeout', 'u', seconds)
            self._start_mode_timer(mode)

    def _start_mode_timer(self, mode):
        """(Re)arm the timer that switches Discoverable/Pairable off again."""
        self.sim.cancel(self.mode_timers.pop(mode, None))
        seconds = getattr(self, mode.lower() + '_timeout')
        if seconds and getattr(self, mode.lower()):
            self.mode_timers[mode] = self.sim.later(seconds, self._mode_expired, mode)

    def _mode_expired(self, mode):
        self.mode_timers.pop(mode, None)
        setattr(self, mode.lower() + '_setting', False)
        self.changed(mode, 'b', False)

    # --- discovery ---------------------------------------------------------

    def start_discovery(self, sender):
        if not self.powered:
            raise bluez_error('NotReady')
        first = not self.discovery
        self.discovery[sender] = self.discovery.get(sender, 0) + 1
        if first:
            self.found_before = None
            self.round_timer = self.sim.later(0, self._start_round)

    def stop_discovery_session(self, sender):
        if not self.powered:
            raise bluez_error('NotReady')
        if sender not in self.discovery:
            raise bluez_error('Failed', 'Invalid discovery session')
        self.discovery[sender] -= 1
        if not self.discovery[sender]:
            del self.discovery[sender]
        if not self.discovery:
            self.stop_discovery()

    def stop_discovery(self):
        """End discovery now (no DeviceDisappeared for this stop)."""
        self.round_timer = self.sim.cancel(self.round_timer)
        if self.discovering:
            self.discovering = False
            self.changed('Discovering', 'b', False)

    def _start_round(self):
        self.discovering = True
        self.found_now = set()
        self.changed('Discovering', 'b', True)
        for dev in self.devices.values():
            if dev.in_range:
                self.report_found(dev)
        self.round_timer = self.sim.later(self.sim.options['round_seconds'], self._end_round)

    def _end_round(self):
        self.discovering = False
        self.changed('Discovering', 'b', False)
        if self.found_before is not None:
            for address in sorted(self.found_before - self.found_now):
                self.sim.emit(self.path, ADAPTER, 'DeviceDisappeared', 's', address)
        self.found_before = self.found_now
        self.round_timer = None
        if self.discovery:
            self._start_round()  # arms the next round's timer itself

    def report_found(self, dev):
        """DeviceFound for a device answering the inquiry of the running round."""
        if self.discovering and dev.address not in self.found_now:
            self.found_now.add(dev.address)
            self.sim.emit(self.path, ADAPTER, 'DeviceFound', 'sa{sv}', dev.address, dev.found_properties())

    # --- clients -----------------------------------------------------------

    def client_gone(self, name):
        """A client left the bus: drop its sessions, agent and pairings."""
        if self.discovery.pop(name, None) and not self.discovery:
            self.stop_discovery()
        if self.agent and self.agent.name == name:
            self.agent = None
        if self.sessions.pop(name, None) and not self.sessions:
            self.restore_mode()
        for dev in list(self.devices.values()):
            if dev.pairing and dev.pairing.owner == name:
                dev.pairing.cancel()

    def restore_mode(self):
        """Last RequestSession released: back to the mode the user had set."""
        if not self.global_powered:
            self.set_powered(False, by_user=False)

    def release_agent(self, agent):
        """Agent going away: Cancel its pending request, then Release."""
        for dev in self.devices.values():
            if dev.pairing and dev.pairing.request and dev.pairing.request.outstanding \
                    and agent.same(dev.pairing.request.agent):
                dev.pairing.cancel()
        self.sim.send_agent(agent, 'Release')

    def shut_down(self):
        """The adapter is removed: end what it was doing."""
        self.stop_discovery()
        for dev in self.devices.values():
            if dev.pairing:
                dev.pairing.cancel()
        if self.agent:
            self.release_agent(self.agent)
            self.agent = None

    def unexport_all(self):
        for dev in self.devices.values():
            dev.cancel_timers()
            if dev.exported:
                self.sim.unexport(dev.path)
        for tid in self.mode_timers.values():
            self.sim.cancel(tid)
        self.sim.cancel(self.round_timer)
        self.sim.unexport(self.path)


class Device:
    """A remote device: neighbour data plus, once created, its D-Bus object state."""

    def __init__(self, adapter, info):
        self.adapter, self.sim, self.info = adapter, adapter.sim, info
        self.address = info.address
        self.path = f'{adapter.path}/dev_{info.address.replace(":", "_")}'
        self.alias = info.alias
        self.paired, self.trusted, self.blocked = info.paired, info.trusted, info.blocked
        self.in_range = info.in_range  # live state: the scene's value stays for Reset
        self.exported = False
        self.temporary = False
        self.connected = False
        self.known_uuids = list(info.uuids) if info.created else []
        self.profiles = False
        self.sink_state = 'disconnected'
        self.audio_state = 'disconnected'
        self.control_connected = False
        self.pairing = None
        self.removing = False
        self.idle_timer = None
        self.audio_timer = None

    # --- properties --------------------------------------------------------

    @property
    def alias_text(self):
        return self.alias or self.info.name or sc.dashed(self.address)

    def properties(self):
        items = [('Address', 's', self.address), ('Name', 's', self.info.name),
                 ('Alias', 's', self.alias_text)]
        if self.info.cls:
            items.append(('Class', 'u', self.info.cls))
        if self.info.icon:
            items.append(('Icon', 's', self.info.icon))
        items += [('Paired', 'b', self.paired), ('Trusted', 'b', self.trusted),
                  ('Blocked', 'b', self.blocked), ('Connected', 'b', self.connected),
                  ('UUIDs', 'as', self.known_uuids), ('Services', 'ao', []),
                  ('Adapter', 'o', self.adapter.path)]
        return props_dict(items)

    def found_properties(self):
        """The DeviceFound dictionary; legacy devices send no EIR, hence no UUIDs."""
        info = self.info
        items = [('Address', 's', self.address), ('Class', 'u', info.cls)]
        if info.icon:
            items.append(('Icon', 's', info.icon))
        items.append(('RSSI', 'n', info.rssi))
        if info.name:
            items.append(('Name', 's', info.name))
        items += [('Alias', 's', self.alias_text), ('LegacyPairing', 'b', info.legacy),
                  ('Paired', 'b', self.paired and self.exported), ('Trusted', 'b', self.trusted and self.exported)]
        if info.uuids and not info.legacy:
            items.append(('UUIDs', 'as', info.uuids))
        return props_dict(items)

    def changed(self, name, sig, value, iface=DEVICE):
        self.sim.emit_property(self.path, iface, name, sig, value)

    # --- object lifetime ---------------------------------------------------

    def export_object(self, temporary):
        """Create the D-Bus object; returns False if it already existed."""
        from .interfaces import DeviceInterface
        if self.exported:
            return False
        self.exported, self.temporary = True, temporary
        self.sim.export(self.path, DEVICE, DeviceInterface(self))
        if self.info.created and not temporary:
            self.register_profiles()
        return True

    def create_object(self):
        """Create a temporary object at runtime: DeviceCreated, then Devices."""
        if self.export_object(temporary=True):
            self.sim.emit(self.adapter.path, ADAPTER, 'DeviceCreated', 'o', self.path)
            self.adapter.devices_changed()

    def remove_object(self):
        """Remove the object: Devices, then DeviceRemoved; stored data is forgotten."""
        if not self.exported:
            return
        self.cancel_timers()
        self.sim.unexport(self.path)
        self.exported = self.temporary = self.profiles = self.removing = False
        self.paired = self.trusted = self.blocked = False
        self.alias = ''
        self.known_uuids = []
        self.adapter.devices_changed()
        self.sim.emit(self.adapter.path, ADAPTER, 'DeviceRemoved', 'o', self.path)

    def cancel_timers(self):
        self.idle_timer = self.sim.cancel(self.idle_timer)
        self.audio_timer = self.sim.cancel(self.audio_timer)

    def services_resolved(self):
        """SDP done: stored UUIDs updated and profile interfaces registered."""
        if self.known_uuids != self.info.uuids:
            self.known_uuids = list(self.info.uuids)
            self.changed('UUIDs', 'as', self.known_uuids)
        if not self.profiles:
            self.register_profiles()

    def register_profiles(self):
        from .interfaces import AudioInterface, AudioSinkInterface, ControlInterface
        self.profiles = True
        if self.blocked or not self.info.audio:
            return
        self.sim.export(self.path, AUDIO, AudioInterface(self))
        if 'sink' in self.info.audio:
            self.sim.export(self.path, AUDIO_SINK, AudioSinkInterface(self))
        if 'control' in self.info.audio:
            self.sim.export(self.path, CONTROL, ControlInterface(self))

    def unregister_profiles(self):
        for iface in (AUDIO, AUDIO_SINK, CONTROL):
            self.sim.unexport_interface(self.path, iface)

    def set_paired(self):
        self.paired = True
        self.temporary = False
        self.changed('Paired', 'b', True)

    def set_trusted(self, on):
        if on != self.trusted:
            self.trusted = on
            self.changed('Trusted', 'b', on)

    def set_blocked(self, on):
        if on == self.blocked:
            return
        if on:
            self.link_down()
            self.blocked = True
            self.changed('Blocked', 'b', True)
            self.unregister_profiles()
        else:
            self.blocked = False
            self.changed('Blocked', 'b', False)
            if self.profiles:
                self.register_profiles()

    # --- the ACL link ------------------------------------------------------

    def link_up(self):
        self.idle_timer = self.sim.cancel(self.idle_timer)
        if not self.connected:
            self.connected = True
            self.changed('Connected', 'b', True)

    def link_idle(self):
        """Nothing needs the link any more: it drops after the idle time."""
        busy = self.pairing or self.sink_state != 'disconnected' or self.control_connected \
            or self.audio_state != 'disconnected'
        if self.connected and not busy and self.idle_timer is None:
            self.idle_timer = self.sim.later(self.sim.options['idle_seconds'], self._idle_expired)

    def _idle_expired(self):
        self.idle_timer = None
        self.link_down()

    def link_down(self):
        """The link is gone: audio goes down, Connected false, a temporary object goes."""
        self.cancel_timers()
        self.audio_down()
        if self.connected:
            self.connected = False
            self.changed('Connected', 'b', False)
        if self.temporary:
            self.remove_object()

    def request_disconnect(self, then):
        """DisconnectRequested now, the link drops a moment later, then `then()`."""
        self.sim.emit(self.path, DEVICE, 'DisconnectRequested')

        def down():
            self.link_down()
            then()
        self.sim.later(self.sim.options['disconnect_seconds'], down)

    # --- audio -------------------------------------------------------------

    def set_sink_state(self, state):
        if state != self.sink_state:
            self.sink_state = state
            self.changed('State', 's', state, AUDIO_SINK)

    def set_audio_state(self, state):
        if state != self.audio_state:
            self.audio_state = state
            self.changed('State', 's', state, AUDIO)

    def audio_connect(self, call, whole):
        """Audio.Connect (whole=True) or AudioSink.Connect."""
        has_sink = 'sink' in self.info.audio
        if whole and self.audio_state == 'connecting' or not whole and self.sink_state == 'connecting':
            raise bluez_error('InProgress', 'In Progress' if whole else 'Operation already in progress')
        if whole and self.audio_state == 'connected' or not whole and self.sink_state in ('connected', 'playing'):
            raise bluez_error('AlreadyConnected')
        if has_sink:
            self.set_sink_state('connecting')
        self.set_audio_state('connecting')
        if not self.in_range:
            self.audio_timer = self.sim.later(self.sim.options['connect_seconds'], self._audio_failed, call, whole)
            return PENDING
        self.link_up()
        self.audio_timer = self.sim.later(self.sim.options['connect_seconds'], self._audio_up, call)
        return PENDING

    def _audio_failed(self, call, whole):
        self.audio_timer = None
        self.set_sink_state('disconnected')
        self.set_audio_state('disconnected')
        call.fail(bluez_error('Failed', 'Connect Failed' if whole else 'Stream setup failed'))

    def _audio_up(self, call=None):
        self.audio_timer = None
        if 'sink' in self.info.audio and self.sink_state == 'connecting':
            self.sim.emit(self.path, AUDIO_SINK, 'Connected')
            self.changed('Connected', 'b', True, AUDIO_SINK)
            self.set_sink_state('connected')
        self.set_audio_state('connected')
        if call is not None:
            call.ret()
        if 'control' in self.info.audio and not self.control_connected:
            self.control_connected = True
            self.sim.emit(self.path, CONTROL, 'Connected')
            self.changed('Connected', 'b', True, CONTROL)

    def incoming_audio(self, uuid):
        """The remote connected an audio profile itself (accepted IncomingConnection)."""
        wanted = uuid == sc.A2DP_SINK and 'sink' in self.info.audio or \
            uuid in (sc.AVRCP_TARGET, sc.AVRCP_REMOTE) and 'control' in self.info.audio
        if wanted and self.profiles and not self.blocked and self.audio_state == 'disconnected':
            if 'sink' in self.info.audio:
                self.set_sink_state('connecting')
            self.set_audio_state('connecting')
            self._audio_up()

    def audio_disconnect(self, call, whole):
        if whole and self.audio_state == 'disconnected' or not whole and self.sink_state == 'disconnected':
            raise bluez_error('NotConnected')
        if not whole and self.sink_state == 'connecting' or whole and self.audio_state == 'connecting':
            raise bluez_error('InProgress', 'Operation already in progress')
        call.ret()
        self.audio_down()
        self.link_idle()
        return PENDING

    def audio_down(self):
        self.audio_timer = self.sim.cancel(self.audio_timer)
        if self.sink_state == 'playing':
            self.set_playing(False)
        if self.sink_state != 'disconnected':
            if self.sink_state == 'connected':
                self.sim.emit(self.path, AUDIO_SINK, 'Disconnected')
                self.changed('Connected', 'b', False, AUDIO_SINK)
            self.set_sink_state('disconnected')
        self.set_audio_state('disconnected')
        if self.control_connected:
            self.control_connected = False
            self.sim.emit(self.path, CONTROL, 'Disconnected')
            self.changed('Connected', 'b', False, CONTROL)

    def set_playing(self, on):
        if on and self.sink_state == 'connected':
            self.sim.emit(self.path, AUDIO_SINK, 'Playing')
            self.changed('Playing', 'b', True, AUDIO_SINK)
            self.set_sink_state('playing')
        elif not on and self.sink_state == 'playing':
            self.sim.emit(self.path, AUDIO_SINK, 'Stopped')
            self.changed('Playing', 'b', False, AUDIO_SINK)
            self.set_sink_state('connected')
        else:
            raise bluez_error('NotConnected' if self.sink_state == 'disconnected' else 'InProgress')


class PairingResult:
    def __init__(self, error=None, agent_error=None):
        self.error, self.agent_error = error, agent_error


class Pairing:
    """One bonding attempt; asks the agent asynchronously and reports once via `finish`."""

    def __init__(self, device, agent, owner, finish, fallback=None):
        self.device, self.sim = device, device.sim
        self.agent, self.owner, self.finish_cb, self.fallback = agent, owner, finish, fallback
        self.request = None
        self.timer = None
        self.finished = False

    def method(self):
        if self.device.info.uses_pin:
            return 'RequestPinCode'
        return SSP_METHOD[self.agent.capability].get(self.device.info.io)

    def start(self):
        dev = self.device
        method = self.method()
        if method == 'RequestPinCode':
            self._ask(self.agent, method, 'o', [dev.path], self._pin_ok)
        elif method == 'RequestPasskey':
            self._ask(self.agent, method, 'o', [dev.path], lambda v: int(v) == dev.info.passkey)
        elif method == 'RequestConfirmation':
            self._ask(self.agent, method, 'ou', [dev.path, dev.info.passkey], lambda v: True)
        else:
            if method == 'DisplayPasskey':
                self.sim.send_agent(self.agent, method, 'ou', [dev.path, dev.info.passkey])
            self.timer = self.sim.later(0, self._remote_done)

    def _pin_ok(self, pin):
        return 1 <= len(pin) <= 16 and (self.device.info.pin is None or pin == self.device.info.pin)

    def _ask(self, agent, member, sig, args, check):
        def answered(value, error):
            self.request = None
            if error in RETRY_ON_ADAPTER_AGENT and agent is self.agent and self.fallback \
                    and not self.fallback.same(agent):
                self._ask(self.fallback, member, sig, args, check)
            elif error:
                self._finish(PairingResult('AuthenticationFailed', error))
            elif not check(value):
                self._finish(PairingResult('AuthenticationFailed'))
            else:
                self._remote_done()
        self.request = self.sim.call_agent(agent, member, sig, args, answered)

    def _remote_done(self):
        self.timer = None
        if self.device.info.rejects_pairing:
            self._finish(PairingResult('AuthenticationRejected', 'org.bluez.Error.AuthenticationRejected'))
        else:
            self._finish(PairingResult())

    def cancel(self):
        """Abort: Cancel() to an agent still thinking, then fail as canceled."""
        if self.finished:
            return
        if self.request is not None and self.request.outstanding:
            self.request.abandon()
            self.sim.send_agent(self.request.agent, 'Cancel')
        self.timer = self.sim.cancel(self.timer)
        self._finish(PairingResult('AuthenticationCanceled', 'org.bluez.Error.Canceled'))

    def _finish(self, result):
        if not self.finished:
            self.finished = True
            self.device.pairing = None
            self.finish_cb(result)
