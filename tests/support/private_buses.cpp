#include "support/private_buses.h"

#include <cstdlib>
#include <fstream>

#include <unistd.h>

#include <dbus/dbus.h>

#include "support/process.h"

namespace btbus_test {

namespace {

struct Bus {
    const char* kind;
    const char* variable;
    pid_t pid = -1;
};

Bus gBuses[2] = { { "system", "DBUS_SYSTEM_BUS_ADDRESS" }, { "session", "DBUS_SESSION_BUS_ADDRESS" } };

// Allow-all policy: tests own any name and call anything, the agent included.
// The session bus starts the build's services (btbus-scanner) on demand.
std::string writeConfig(const std::string& kind) {
    std::string path = scratchDir() + "/" + kind + "-bus.conf";
    std::ofstream out(path);
    out << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN\"\n"
           " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
           "<busconfig>\n"
           "  <type>session</type>\n"
           "  <listen>unix:tmpdir=" << scratchDir() << "</listen>\n"
           "  <auth>EXTERNAL</auth>\n"
        << (kind == "session" ? "  <servicedir>" BTBUS_SERVICE_DIR "</servicedir>\n" : "")
        << "  <policy context=\"default\">\n"
           "    <allow send_destination=\"*\" eavesdrop=\"true\"/>\n"
           "    <allow eavesdrop=\"true\"/>\n"
           "    <allow own=\"*\"/>\n"
           "  </policy>\n"
           "</busconfig>\n";
    return path;
}

void stopBuses() {
    // The daemons go away under the shared connections: libdbus must not
    // _exit() the test binary when it notices.
    for (Bus& bus : gBuses) {
        if (bus.pid <= 0) continue;
        DBusConnection* shared = dbus_bus_get(&bus == &gBuses[0] ? DBUS_BUS_SYSTEM : DBUS_BUS_SESSION, nullptr);
        if (shared != nullptr) {
            dbus_connection_set_exit_on_disconnect(shared, FALSE);
            dbus_connection_unref(shared);
        }
        stop(bus.pid);
        bus.pid = -1;
    }
}

}  // namespace

void PrivateBuses::SetUp() {
    for (Bus& bus : gBuses) {
        int out = -1;
        bus.pid = spawn({ "dbus-daemon", "--config-file=" + writeConfig(bus.kind), "--nofork",
                          "--print-address=1" },
                        &out);
        ASSERT_GT(bus.pid, 0) << "dbus-daemon is needed: apt-get install dbus-daemon";
        std::string address = readLine(out, 10000ms);
        close(out);
        ASSERT_FALSE(address.empty()) << "the " << bus.kind << " dbus-daemon gave no address";
        setenv(bus.variable, address.c_str(), 1);
    }
    std::atexit(&stopBuses);  // also when a test exits early
}

void PrivateBuses::TearDown() { stopBuses(); }

void PrivateBuses::killSessionBus() {
    stop(gBuses[1].pid, SIGKILL);
    gBuses[1].pid = -1;
}

namespace {
::testing::Environment* const kBuses = ::testing::AddGlobalTestEnvironment(new PrivateBuses);
}

}  // namespace btbus_test
