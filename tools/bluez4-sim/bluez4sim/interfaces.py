"""The BlueZ 4 interfaces: one small class per D-Bus interface.

Each class lists its members in METHODS as (name, in signature, out
signature); Simulator.export() dispatches a call to the method of the same
name with a `Call` as first argument. A handler returns its answer, raises a
BlueZ error, or returns PENDING and answers later through the Call.
"""

import dbus

from . import scene as sc
from .core import (PENDING, Agent, Pairing, bluez_error, check_address)
from .values import basic_signature_of, props_dict


def _plain_unknown_method(lookup):
    """Answer a call to a member an object lacks as the daemon does: a plain
    UnknownMethod error, without the traceback dbus-python attaches to it."""
    def method_lookup(obj, name, interface):
        try:
            return lookup(obj, name, interface)
        except dbus.exceptions.UnknownMethodException:
            raise dbus.exceptions.DBusException(
                f'Method "{name}" on interface "{interface}" doesn\'t exist',
                name='org.freedesktop.DBus.Error.UnknownMethod') from None
    method_lookup.plain_unknown_method = True
    return method_lookup


if not getattr(dbus.service._method_lookup, 'plain_unknown_method', False):  # pylint: disable=protected-access
    dbus.service._method_lookup = _plain_unknown_method(dbus.service._method_lookup)  # pylint: disable=protected-access


class ManagerInterface:
    METHODS = [('GetProperties', '', 'a{sv}'), ('DefaultAdapter', '', 'o'),
               ('FindAdapter', 's', 'o'), ('ListAdapters', '', 'ao')]

    def __init__(self, sim):
        self.sim = sim

    def GetProperties(self, call):
        return props_dict([('Adapters', 'ao', self.sim.adapter_paths())])

    def DefaultAdapter(self, call):
        if self.sim.default is None:
            raise bluez_error('NoSuchAdapter')
        return self.sim.adapters[self.sim.default].path

    def FindAdapter(self, call, pattern):
        for adapter in self.sim.adapters.values():
            if pattern == adapter.name or pattern.upper() == adapter.address:
                return adapter.path
        raise bluez_error('NoSuchAdapter')

    def ListAdapters(self, call):
        return dbus.Array(self.sim.adapter_paths(), signature='o')


ADAPTER_WRITABLE = {'Name': 's', 'Powered': 'b', 'Discoverable': 'b', 'Pairable': 'b',
                    'DiscoverableTimeout': 'u', 'PairableTimeout': 'u'}


def capability(text):
    """Agent capability of RegisterAgent/CreatePairedDevice ('' is DisplayYesNo)."""
    cap = text or 'DisplayYesNo'
    if cap not in sc.CAPABILITIES:
        raise bluez_error('InvalidArguments')
    return cap


class AdapterInterface:
    METHODS = [('GetProperties', '', 'a{sv}'), ('SetProperty', 'sv', ''),
               ('RequestSession', '', ''), ('ReleaseSession', '', ''),
               ('StartDiscovery', '', ''), ('StopDiscovery', '', ''),
               ('FindDevice', 's', 'o'), ('ListDevices', '', 'ao'),
               ('CreateDevice', 's', 'o'), ('CreatePairedDevice', 'sos', 'o'),
               ('CancelDeviceCreation', 's', ''), ('RemoveDevice', 'o', ''),
               ('RegisterAgent', 'os', ''), ('UnregisterAgent', 'o', '')]

    def __init__(self, adapter):
        self.adapter, self.sim = adapter, adapter.sim

    def GetProperties(self, call):
        return self.adapter.properties()

    def SetProperty(self, call, name, value):
        adapter = self.adapter
        if ADAPTER_WRITABLE.get(name) != basic_signature_of(value):
            raise bluez_error('InvalidArguments')
        if name == 'Name':
            if len(value.encode('utf-8')) > 248:
                raise bluez_error('InvalidArguments')
            if value != adapter.alias:
                adapter.alias = str(value)
                adapter.changed('Name', 's', adapter.alias)
        elif name == 'Powered':
            adapter.set_powered(bool(value))
        elif name == 'Discoverable':
            adapter.set_discoverable(bool(value))
        elif name == 'Pairable':
            adapter.set_pairable(bool(value))
        else:
            adapter.set_mode_timeout(name[:-len('Timeout')], int(value))

    def RequestSession(self, call):
        adapter = self.adapter
        if adapter.agent is None:
            raise bluez_error('AgentNotAvailable')
        if not adapter.sessions:
            adapter.global_powered = adapter.powered
        if adapter.powered or call.sender in adapter.sessions:
            adapter.sessions[call.sender] = adapter.sessions.get(call.sender, 0) + 1
            return None

        def answered(_value, error):
            if error:
                call.fail(dbus.DBusException('Mode change refused by agent', name=error))
                return
            adapter.sessions[call.sender] = adapter.sessions.get(call.sender, 0) + 1
            adapter.set_powered(True, by_user=False)
            call.ret()
        self.sim.call_agent(adapter.agent, 'ConfirmModeChange', 's', ['connectable'], answered)
        return PENDING

    def ReleaseSession(self, call):
        sessions = self.adapter.sessions
        if call.sender not in sessions:
            raise bluez_error('Failed', 'Invalid Session')
        sessions[call.sender] -= 1
        if not sessions[call.sender]:
            del sessions[call.sender]
            if not sessions:
                self.adapter.restore_mode()

    def StartDiscovery(self, call):
        self.adapter.start_discovery(call.sender)

    def StopDiscovery(self, call):
        self.adapter.stop_discovery_session(call.sender)

    def FindDevice(self, call, address):
        dev = self.adapter.find(address)
        if not dev.exported:
            raise bluez_error('DoesNotExist')
        return dev.path

    def ListDevices(self, call):
        return dbus.Array(self.adapter.object_paths(), signature='o')

    def CreateDevice(self, call, address):
        address = check_address(address)
        if not self.adapter.powered:
            raise bluez_error('NotReady')
        dev = self.adapter.neighbour(address)
        if dev.exported:
            raise bluez_error('AlreadyExists')
        dev.create_object()
        if not dev.in_range:
            call.fail(bluez_error('Failed', 'Host is down'))
            dev.remove_object()
            return PENDING
        dev.link_up()
        dev.temporary = False
        dev.services_resolved()
        call.ret(dev.path)
        dev.link_idle()
        return PENDING

    def CreatePairedDevice(self, call, address, agent_path, cap):
        adapter = self.adapter
        address = check_address(address)
        agent = Agent(call.sender, agent_path, capability(cap))
        if agent.same(adapter.agent):
            raise bluez_error('InvalidArguments')
        if not adapter.powered:
            raise bluez_error('NotReady')
        dev = adapter.neighbour(address)
        if dev.pairing:
            raise bluez_error('InProgress')
        if dev.paired:
            raise bluez_error('AlreadyExists')
        dev.create_object()
        if not dev.in_range:
            call.fail(bluez_error('ConnectionAttemptFailed', 'Page Timeout'))
            self.sim.send_agent(agent, 'Release')
            dev.link_down()
            return PENDING
        dev.link_up()

        def finished(result):
            if result.error is None:
                dev.set_paired()
                self.sim.send_agent(agent, 'Release')
                dev.services_resolved()
                call.ret(dev.path)
                dev.link_idle()
            else:
                call.fail(bluez_error(result.error))
                self.sim.send_agent(agent, 'Release')
                dev.link_down()

        dev.pairing = Pairing(dev, agent, call.sender, finished, fallback=adapter.agent)
        dev.pairing.start()
        return PENDING

    def CancelDeviceCreation(self, call, address):
        address = check_address(address)
        dev = self.adapter.devices.get(address)
        if dev is None or dev.pairing is None:
            raise bluez_error('DoesNotExist')
        if dev.pairing.owner != call.sender:
            raise bluez_error('NotAuthorized')
        if dev.connected:
            self.sim.emit(dev.path, 'org.bluez.Device', 'DisconnectRequested')
        dev.pairing.cancel()

    def RemoveDevice(self, call, path):
        dev = self.adapter.by_path(path)
        if dev is None:
            raise bluez_error('DoesNotExist')
        if dev.temporary or dev.pairing or dev.removing:
            raise bluez_error('DoesNotExist', 'Device creation in progress')
        if not dev.connected:
            dev.remove_object()
            return None
        dev.removing = True

        def link_gone():
            call.ret()
            dev.remove_object()
        dev.request_disconnect(link_gone)
        return PENDING

    def RegisterAgent(self, call, path, cap):
        agent = Agent(call.sender, path, capability(cap))
        if self.adapter.agent is not None:
            raise bluez_error('AlreadyExists')
        self.adapter.agent = agent

    def UnregisterAgent(self, call, path):
        agent = self.adapter.agent
        if agent is None or not agent.same(Agent(call.sender, path, '')):
            raise bluez_error('DoesNotExist')
        self.adapter.agent = None
        self.adapter.release_agent(agent)


DEVICE_WRITABLE = {'Trusted': 'b', 'Alias': 's', 'Blocked': 'b'}


class DeviceInterface:
    METHODS = [('GetProperties', '', 'a{sv}'), ('SetProperty', 'sv', ''),
               ('DiscoverServices', 's', 'a{us}'), ('CancelDiscovery', '', ''),
               ('Disconnect', '', '')]

    def __init__(self, device):
        self.dev = device

    def GetProperties(self, call):
        return self.dev.properties()

    def SetProperty(self, call, name, value):
        dev = self.dev
        if DEVICE_WRITABLE.get(name) != basic_signature_of(value):
            raise bluez_error('InvalidArguments')
        if name == 'Trusted':
            dev.set_trusted(bool(value))
        elif name == 'Blocked':
            dev.set_blocked(bool(value))
        elif str(value) != dev.alias:
            dev.alias = str(value)
            dev.changed('Alias', 's', dev.alias)

    def DiscoverServices(self, call, pattern):
        dev = self.dev
        uuid = sc.service_pattern(pattern)
        if uuid is None:
            raise bluez_error('InvalidArguments')
        if not dev.in_range:
            raise bluez_error('ConnectionAttemptFailed', 'Host is down')
        records = {handle: xml for handle, xml in dev.info.services.items()
                   if not uuid or uuid in sc.record_classes(xml)}
        dev.link_up()
        if not uuid:
            dev.services_resolved()
        call.ret(dbus.Dictionary(records, signature='us'))
        dev.link_idle()
        return PENDING

    def CancelDiscovery(self, call):
        raise bluez_error('DoesNotExist')

    def Disconnect(self, call):
        if not self.dev.connected:
            raise bluez_error('NotConnected')
        self.dev.request_disconnect(call.ret)
        return PENDING


class AudioInterface:
    METHODS = [('Connect', '', ''), ('Disconnect', '', ''), ('GetProperties', '', 'a{sv}')]

    def __init__(self, device):
        self.dev = device

    def Connect(self, call):
        return self.dev.audio_connect(call, whole=True)

    def Disconnect(self, call):
        return self.dev.audio_disconnect(call, whole=True)

    def GetProperties(self, call):
        return props_dict([('State', 's', self.dev.audio_state)])


class AudioSinkInterface:
    METHODS = [('Connect', '', ''), ('Disconnect', '', ''), ('IsConnected', '', 'b'),
               ('GetProperties', '', 'a{sv}')]

    def __init__(self, device):
        self.dev = device

    def Connect(self, call):
        return self.dev.audio_connect(call, whole=False)

    def Disconnect(self, call):
        return self.dev.audio_disconnect(call, whole=False)

    def IsConnected(self, call):
        return self.dev.sink_state in ('connected', 'playing')

    def GetProperties(self, call):
        state = self.dev.sink_state
        return props_dict([('Playing', 'b', state == 'playing'),
                           ('Connected', 'b', state in ('connected', 'playing')),
                           ('State', 's', state)])


class ControlInterface:
    METHODS = [('IsConnected', '', 'b'), ('GetProperties', '', 'a{sv}'),
               ('VolumeUp', '', ''), ('VolumeDown', '', '')]

    def __init__(self, device):
        self.dev = device

    def IsConnected(self, call):
        return self.dev.control_connected

    def GetProperties(self, call):
        return props_dict([('Connected', 'b', self.dev.control_connected)])

    def _pass_through(self):
        if not self.dev.control_connected:
            raise bluez_error('NotConnected')
        if sc.AVRCP_TARGET not in self.dev.info.uuids:
            raise bluez_error('NotSupported')

    def VolumeUp(self, call):
        self._pass_through()

    def VolumeDown(self, call):
        self._pass_through()
