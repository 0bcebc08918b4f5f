"""org.btbus.Simulator: the interface tests and demos use to drive the simulator.

All arguments are simple types; structured input is JSON text. Answers of
the "incoming" requests are strings: "accepted", "trusted" or an error name.
"""

import json

import dbus
import dbus.lowlevel

from . import scene as sc
from .core import PENDING, Device, Pairing, bluez_error
from .values import ConversionError, args_to_dbus

CONTROL_PATH = '/org/btbus/Simulator'
CONTROL_IFACE = 'org.btbus.Simulator'
CANCELED = 'org.bluez.Error.Canceled'
NO_AGENT = 'org.bluez.Error.AgentNotAvailable'


def invalid(error):
    return bluez_error('InvalidArguments', str(error))


class ControlPanel:
    METHODS = [('Reset', '', ''), ('LoadScene', 's', ''), ('AddAdapter', 'ss', 'o'),
               ('RemoveAdapter', 's', ''), ('AddDevice', 'ss', ''), ('SetInRange', 'ssb', ''),
               ('SetPlaying', 'ssb', ''), ('StartIncomingPairing', 'ss', 's'),
               ('IncomingConnection', 'sss', 's'), ('EmitSignal', 'ossss', ''),
               ('GetCallLog', '', 'as'), ('ClearCallLog', '', '')]

    def __init__(self, sim):
        self.sim = sim

    def Reset(self, call):
        self.sim.reset()

    def LoadScene(self, call, text):
        try:
            scene = sc.load_scene_text(text)
        except sc.SceneError as e:
            raise invalid(e) from e
        self.sim.reset(scene)

    def AddAdapter(self, call, name, address):
        try:
            info = sc.AdapterInfo({'name': name, 'address': address})
        except sc.SceneError as e:
            raise invalid(e) from e
        return self.sim.add_adapter(info)

    def RemoveAdapter(self, call, name):
        self.sim.remove_adapter(name)

    def AddDevice(self, call, adapter_name, text):
        adapter = self.sim.adapter(adapter_name)
        try:
            info = sc.DeviceInfo(json.loads(text))
        except (ValueError, sc.SceneError) as e:
            raise invalid(e) from e
        old = adapter.devices.get(info.address)
        if old is not None and (old.exported or old.pairing):
            raise bluez_error('AlreadyExists')
        dev = adapter.devices[info.address] = Device(adapter, info)
        if info.created:
            dev.export_object(temporary=False)
            self.sim.emit(adapter.path, 'org.bluez.Adapter', 'DeviceCreated', 'o', dev.path)
            adapter.devices_changed()
        if info.in_range:
            adapter.report_found(dev)

    def SetInRange(self, call, adapter_name, address, in_range):
        adapter = self.sim.adapter(adapter_name)
        dev = adapter.find(address)
        if dev.in_range == bool(in_range):
            return
        dev.in_range = bool(in_range)
        if in_range:
            adapter.report_found(dev)
            return
        if dev.pairing:
            dev.pairing.cancel()
        dev.link_down()

    def SetPlaying(self, call, adapter_name, address, playing):
        dev = self.sim.adapter(adapter_name).find(address)
        dev.set_playing(bool(playing))

    def _remote(self, adapter_name, address):
        """Adapter and device for a request the remote device starts."""
        adapter = self.sim.adapter(adapter_name)
        if not adapter.powered:
            raise bluez_error('NotReady')
        dev = adapter.find(address)
        if not dev.in_range:
            raise bluez_error('NotAvailable', 'Device is out of range')
        return adapter, dev

    def StartIncomingPairing(self, call, adapter_name, address):
        adapter, dev = self._remote(adapter_name, address)
        if adapter.agent is None:
            return NO_AGENT
        if dev.pairing:
            return 'org.bluez.Error.InProgress'
        if dev.blocked:
            return 'org.bluez.Error.NotAuthorized'
        if not adapter.pairable:
            return 'org.bluez.Error.AuthenticationRejected'
        dev.create_object()
        dev.link_up()
        call.reset_value = CANCELED

        def finished(result):
            if result.error is None:
                dev.set_paired()
                dev.services_resolved()
                call.ret('accepted')
                dev.link_idle()
            else:
                call.ret(result.agent_error or 'org.bluez.Error.' + result.error)
                dev.link_down()

        dev.pairing = Pairing(dev, adapter.agent, None, finished)
        dev.pairing.start()
        return PENDING

    def IncomingConnection(self, call, adapter_name, address, uuid):
        uuid128 = sc.normalize_uuid(uuid)
        if uuid128 is None:
            raise bluez_error('InvalidArguments')
        adapter, dev = self._remote(adapter_name, address)
        if dev.blocked:
            return 'org.bluez.Error.NotAuthorized'
        dev.create_object()
        dev.link_up()
        if dev.trusted:
            dev.incoming_audio(uuid128)
            dev.link_idle()
            return 'trusted'
        if adapter.agent is None:
            dev.link_idle()
            return NO_AGENT
        call.reset_value = CANCELED

        def answered(_value, error):
            call.ret(error or 'accepted')
            if not error:
                dev.incoming_audio(uuid128)
            dev.link_idle()
        self.sim.call_agent(adapter.agent, 'Authorize', 'os', [dev.path, uuid128], answered)
        return PENDING

    def EmitSignal(self, call, path, iface, member, signature, json_args):
        try:
            args = args_to_dbus(signature, json.loads(json_args))
            msg = dbus.lowlevel.SignalMessage(path, iface, member)
            if signature:
                msg.append(*args, signature=signature)
        except (ValueError, TypeError, ConversionError) as e:
            raise invalid(e) from e
        self.sim.conn.send_message(msg)

    def GetCallLog(self, call):
        return dbus.Array([entry.render() for entry in self.sim.call_log], signature='s')

    def ClearCallLog(self, call):
        self.sim.call_log = []
