#include "support/sim.h"

#include <csignal>
#include <cstdlib>

#include <gtest/gtest.h>

#include <bluetooth/dbus_object.h>
#include <bluetooth/remote_object.h>

#include "core/call.h"
#include "support/process.h"

namespace btbus_test {

namespace {

using Bluetooth::ObjectPath;
using Bluetooth::RemoteObject;

const char kControlPath[] = "/org/btbus/Simulator";
const char kControlInterface[] = "org.btbus.Simulator";

pid_t gSim = -1;
RemoteObject* gLoop = nullptr;

// Torn down before the private buses, which were registered earlier.
class SimEnvironment : public ::testing::Environment {
public:
    void TearDown() override {
        sim::kill();
        if (gLoop != nullptr) {
            gLoop->stopLoop();
            gLoop->waitLoop();
            delete gLoop;
            gLoop = nullptr;
        }
    }
};

// One control call; the reply is read by read (null: none awaited).
template <typename Read, typename... A>
bool control(const char* method, Read read, const A&... args) {
    RemoteObject object("org.bluez", kControlPath, kControlInterface, DBUS_BUS_SYSTEM);
    int result = object.newMessage(method);
    if (result == 0) result = Bluetooth::internal::appendAll(object, args...);
    if (result == 0) result = object.sendMessage(true, -1);
    if (result == 0) result = read(object);
    if (result != 0) {
        ADD_FAILURE() << "bluez4-sim " << method << " failed: " << object.getErrorMessage();
        return false;
    }
    return true;
}

int noReply(RemoteObject&) { return 0; }

}  // namespace

namespace sim {

bool start() {
    if (gSim > 0) return control("Reset", &noReply);  // a new one starts from the starting scene anyway
    requireDbusmock();
    if (::testing::Test::HasFatalFailure()) return false;
    static bool registered = false;
    if (!registered) {
        registered = true;
        ::testing::AddGlobalTestEnvironment(new SimEnvironment);
        std::atexit([] { stop(gSim, SIGKILL); });  // also when a test exits early
    }
    // Short rounds and links, so that discovery and idle links show quickly.
    gSim = spawn({ kDebianPython, "-m", "dbusmock", "--system", "--template",
                   std::string(BTBUS_SOURCE_DIR) + "/tools/bluez4-sim/bluez4.py", "-p",
                   "{\"round_seconds\": 0.3, \"idle_seconds\": 0.5}" });
    if (gSim > 0 && waitForName(DBUS_BUS_SYSTEM, "org.bluez")) return true;
    ADD_FAILURE() << "bluez4-sim did not start and take org.bluez";
    kill();
    return false;
}

void kill() {
    if (gSim <= 0) return;
    stop(gSim, SIGKILL);
    gSim = -1;
    waitUntil([] { return !nameHasOwner(DBUS_BUS_SYSTEM, "org.bluez"); });
}

void freeze(bool frozen) {
    if (gSim > 0) ::kill(gSim, frozen ? SIGSTOP : SIGCONT);
}

std::string addAdapter(const std::string& name, const std::string& address) {
    ObjectPath path;
    bool ok = control("AddAdapter", [&](RemoteObject& o) { return o.getReplyValue(path); },
                      name.c_str(), address.c_str());
    return ok ? path.str() : std::string();
}

void removeAdapter(const std::string& name) { control("RemoveAdapter", &noReply, name.c_str()); }

void addDevice(const std::string& adapter, const std::string& json) {
    control("AddDevice", &noReply, adapter.c_str(), json.c_str());
}

void setInRange(const std::string& adapter, const std::string& address, bool inRange) {
    control("SetInRange", &noReply, adapter.c_str(), address.c_str(), inRange);
}

void setPlaying(const std::string& adapter, const std::string& address, bool playing) {
    control("SetPlaying", &noReply, adapter.c_str(), address.c_str(), playing);
}

void emitSignal(const std::string& path, const std::string& interface, const std::string& member,
                const std::string& signature, const std::string& jsonArgs) {
    control("EmitSignal", &noReply, ObjectPath(path), interface.c_str(), member.c_str(),
            signature.c_str(), jsonArgs.c_str());
}

void clearCallLog() { control("ClearCallLog", &noReply); }

std::string defaultAdapterPath() {
    RemoteObject manager("org.bluez", "/", "org.bluez.Manager", DBUS_BUS_SYSTEM);
    ObjectPath path;
    if (manager.newMessage("DefaultAdapter") != 0 || manager.sendMessage(true, -1) != 0 ||
        manager.getReplyValue(path) != 0)
        return "";
    return path.str();
}

std::string devicePath(const std::string& address) {
    std::string path = defaultAdapterPath() + "/dev_" + address;
    for (char& c : path)
        if (c == ':') c = '_';
    return path;
}

std::vector<std::string> logLinesWith(const std::string& text) {
    std::vector<std::string> lines, found;
    control("GetCallLog", [&](RemoteObject& o) { return o.getReplyValue(lines); });
    for (const std::string& line : lines)
        if (line.find(text) != std::string::npos) found.push_back(line);
    return found;
}

bool waitForLogLine(const std::string& text) {
    return waitUntil([&] { return !logLinesWith(text).empty(); });
}

RemoteObject* receivingLoop() {
    if (gLoop == nullptr) {
        gLoop = new Bluetooth::DBusObject;
        EXPECT_EQ(gLoop->startLoop(), 0);
    }
    return gLoop;
}

bool receivingLoopRunning() { return gLoop != nullptr; }

}  // namespace sim

}  // namespace btbus_test
