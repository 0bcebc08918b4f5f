// autoconnect, name, restart-daemon: the appliance's helpers.
#include <algorithm>
#include <cstdlib>
#include <map>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

namespace {

const char kConfigDir[] = "/etc/bluetooth/autoconnect/";

// The adapter's stored devices that bluetoothd knows, in file order. The
// library prunes addresses bluetoothd no longer knows from an enabled file.
std::vector<std::string> storedDevices(AutoConnect& autoConnect, const std::string& address) {
    std::unique_ptr<DeviceList> devices(autoConnect.getDeviceList(address.c_str()));
    if (!devices) throw Failure("cannot read " + std::string(kConfigDir) + address);
    std::vector<std::string> addresses;
    for (Device* device : *devices)
        if (device) addresses.push_back(shortName(device->getPath()));
    return addresses;
}

std::string listText(const std::vector<std::string>& addresses) {
    std::string text;
    for (const std::string& address : addresses) text += "," + address;
    return text;
}

}  // namespace

int autoConnect(const Options& options, const std::string& action, const std::string& given) {
    std::string device = given;  // stored as bluetoothd writes addresses
    std::transform(device.begin(), device.end(), device.begin(), ::toupper);
    AutoConnect control;
    typedef bool (AutoConnect::*Command)() const;
    const std::map<std::string, Command> commands = {
        {"reload", &AutoConnect::reload}, {"pause", &AutoConnect::pause}, {"resume", &AutoConnect::resume}};
    Output out(options);
    auto command = commands.find(action);
    if (command != commands.end()) {
        if (!device.empty()) throw UsageError("autoconnect " + action + " takes no address");
        if (!(control.*command->second)())
            throw Failure("no auto-connect daemon reads /tmp/quill_bluetooth_autoconnect: " + action + " not sent");
        out.print(options.json ? json{{"sent", action}}.dump() : action + " sent to the auto-connect daemon");
        return kOk;
    }
    bool needsDevice = action == "add" || action == "remove";
    if (needsDevice == device.empty())
        throw UsageError("autoconnect " + action + (needsDevice ? " needs an address" : " takes no address"));

    std::pair<std::string, std::string> local = adapterIdentity(options);
    const std::string& address = local.second;
    bool enabled = control.getEnable(address.c_str());
    std::vector<std::string> devices = storedDevices(control, address);
    if (action != "show") {
        if (action == "enable" || action == "disable") enabled = action == "enable";
        auto at = std::find(devices.begin(), devices.end(), device);
        if (action == "add" && at == devices.end()) {
            std::unique_ptr<Manager> bluez = manager();
            Options chosen = options;
            chosen.adapter = address;
            knownDevice(*adapter(*bluez, chosen), device);  // only devices bluetoothd knows are kept
            devices.push_back(device);
        }
        if (action == "remove") {
            if (at == devices.end()) throw Failure(device + " is not in the auto-connect list of " + local.first);
            devices.erase(at);
        }
        // Rewrites the file and tells a running daemon to reload.
        if (!control.set(address.c_str(), enabled, listText(devices).c_str()))
            throw Failure("cannot write " + std::string(kConfigDir) + address);
    }
    std::string file = kConfigDir + address;
    if (options.json) {
        out.print(json{{"adapter", local.first}, {"address", address}, {"enabled", enabled},
                       {"devices", devices}, {"file", file}});
    } else {
        std::string text = local.first + ": auto-connect " + (enabled ? "enabled" : "disabled") + ", " +
                           std::to_string(devices.size()) + " device(s) (" + file + ")";
        for (const std::string& each : devices) text += "\n  " + each;
        out.print(text);
    }
    return kOk;
}

int remoteName(const Options& options, const std::string& address, const std::string& wait) {
    const std::map<std::string, GetNameTimeout> timeouts = {{"short", GET_NAME_TIMEOUT_SHORT},
                                                             {"default", GET_NAME_TIMEOUT_DEFAULT},
                                                             {"long", GET_NAME_TIMEOUT_LONG}};
    char name[249] = "";
    if (getNameFromAddr(address.c_str(), name, sizeof name, timeouts.at(wait)) != 0)
        throw Failure("cannot read the name of " + address +
                      " over HCI: no local adapter reaches it, or it did not answer");
    Output out(options);
    out.print(options.json ? json{{"address", address}, {"name", name}}.dump() : std::string(name));
    return kOk;
}

int restartDaemon(const Options& options) {
    if (restartBluetoothd() != 0)
        throw Failure("bluetoothd was not restarted: no adapter is attached (no /tmp/bluetooth.info_* file), "
                      "or /usr/sbin/bluetoothd did not start");
    Output out(options);
    out.print(options.json ? json{{"restarted", true}}.dump() : std::string("bluetoothd restarted"));
    return kOk;
}

}  // namespace btbusctl
