// The Scanner client against btbus-scanner started by bus activation, the idle
// exit, and the service object base.
#include <atomic>
#include <chrono>
#include <memory>
#include <thread>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "integration/scanner/scanner_peer.h"
#include "support/log_capture.h"
#include "support/sim.h"

namespace {

using namespace btbus_test;
using namespace Bluetooth;
namespace sim = btbus_test::sim;
using Clock = std::chrono::steady_clock;
typedef std::vector<std::pair<std::string, Dict*> > DeviceDicts;

// Deletes the list and every Dict in it.
struct ReleaseDevices {
    void operator()(DeviceDicts* devices) const {
        for (auto& device : *devices) delete device.second;
        delete devices;
    }
};
using Devices = std::unique_ptr<DeviceDicts, ReleaseDevices>;

bool scannerRuns() { return nameHasOwner(DBUS_BUS_SESSION, kScannerName); }

// Ends the daemon that the bus started for this test, if one runs.
void stopActivatedDaemon() {
    Bluetooth::internal::ScopedError error;
    Bluetooth::internal::MessagePtr reply = callOnSession("org.freedesktop.DBus", "/org/freedesktop/DBus",
                                                          "org.freedesktop.DBus", "GetConnectionUnixProcessID",
                                                          kScannerName, error);
    dbus_uint32_t pid = 0;
    if (reply) dbus_message_get_args(reply.get(), nullptr, DBUS_TYPE_UINT32, &pid, DBUS_TYPE_INVALID);
    if (pid > 0) kill(static_cast<pid_t>(pid), SIGTERM);
    EXPECT_TRUE(waitUntil([] { return !scannerRuns(); }, 10s));
}

class AScanner : public SimTest {
protected:
    void TearDown() override { stopActivatedDaemon(); }
};

TEST_F(AScanner, StartsTheServiceAndListsDevicesWithTextAsDictsOfStrings) {
    ASSERT_FALSE(scannerRuns());
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    Scanner scanner;
    Devices none(scanner.listDevices("hci1", true));
    ASSERT_NE(none, nullptr) << scanner.getErrorMessage();
    EXPECT_TRUE(none->empty());  // the answer's one entry "" to "" holds no separator
    EXPECT_TRUE(scannerRuns());
    const std::string address = "00:11:22:33:44:55", silent = "00:11:22:33:44:66";
    found(hci1, address, R"({"Address": ["s", ")" + address + R"("], "RSSI": ["n", -60]})");
    found(hci1, silent, "{}");
    ASSERT_TRUE(waitUntil([&] { return callScanner("ListDevices", "hci1").devices.count(silent) == 1; }, 10s));
    Devices devices(scanner.listDevices("hci1", true));
    ASSERT_NE(devices, nullptr);
    ASSERT_EQ(devices->size(), 1u);  // the device with an empty text is left out
    EXPECT_EQ(devices->front().first, address);
    const Dict& properties = *devices->front().second;
    EXPECT_EQ(dictToString(properties), "Address: " + address + "\nRSSI: -60\n");
    for (const Entry& entry : properties) EXPECT_EQ(entry.second.which(), 3) << entry.first;  // strings
}

TEST_F(AScanner, AsksNothingOfTheServiceForAnAdapterBluezDoesNotKnowOrWithoutBluez) {
    Scanner scanner;
    LogCapture log;
    EXPECT_FALSE(scanner.removeFinder("hci9"));
    EXPECT_EQ(scanner.listDevices("hci9", true), nullptr);
    EXPECT_FALSE(scannerRuns());  // a call would have started it
    EXPECT_EQ(log.count("manager.cpp:156 No such adapter"), 2u) << ::testing::PrintToString(log.lines());
    EXPECT_TRUE(scanner.removeFinder("hci0"));
    EXPECT_TRUE(waitUntil(&scannerRuns, 10s));
    EXPECT_TRUE(sim::waitForLogLine(" org.bluez.Manager.FindAdapter(hci0)"));
    sim::kill();
    EXPECT_FALSE(scanner.removeFinder("hci0"));
    EXPECT_EQ(scanner.listDevices("hci0", true), nullptr);
}

// The one test that waits for the idle exit. The ticks drift late on a loaded
// machine; an exit postponed by the second call would come 50 s after the first.
TEST_F(AScanner, FindsTheServiceGoneThirtySecondsAfterTheLastFinderAndStartsItAgain) {
    Scanner scanner;
    Clock::time_point created = Clock::now();
    ASSERT_NE(Devices(scanner.listDevices("hci0", true)), nullptr);
    std::this_thread::sleep_for(20s);
    ASSERT_NE(Devices(scanner.listDevices("hci0", true)), nullptr);  // does not postpone the exit
    ASSERT_TRUE(waitUntil([] { return !scannerRuns(); }, 25s));
    double idle = std::chrono::duration<double>(Clock::now() - created).count();
    EXPECT_GT(idle, 29.0);
    EXPECT_NE(Devices(scanner.listDevices("hci0", true)), nullptr);
    EXPECT_TRUE(scannerRuns());
}

GType testObjectType() {
    static GType type = g_type_register_static_simple(
        G_TYPE_OBJECT, "BtbusTestObject", sizeof(GObjectClass), nullptr, sizeof(GObject), nullptr, GTypeFlags(0));
    return type;
}

TEST(AServerObject, ClaimsItsNameAlsoBehindAnotherOwnerAndLogsWhyItCannot) {
    DBusConnection* owner = dbus_bus_get_private(DBUS_BUS_SESSION, nullptr);
    ASSERT_NE(owner, nullptr);
    ASSERT_EQ(dbus_bus_request_name(owner, "org.btbus.Taken", 0, nullptr), DBUS_REQUEST_NAME_REPLY_PRIMARY_OWNER);
    static const DBusGObjectInfo info = { 1, nullptr, 0, "\0", "\0", "\0" };
    const struct {
        const char* name;
        bool claimed;
        const char* log;
    } cases[] = {
        { "org.btbus.Free", true, "" },
        { "org.btbus.Taken", true, "" },  // queued
        { "not a name", false, "server_object.cpp:71 Failed to acquire not a name, " },
    };
    for (const auto& c : cases) {
        LogCapture log;
        ServerObject server(c.name, "/org/btbus/Test", DBUS_BUS_SESSION);
        GObject* object = static_cast<GObject*>(g_object_new(testObjectType(), nullptr));
        EXPECT_EQ(server.prepareObjectInfo(testObjectType(), &info, object), c.claimed) << c.name;
        std::string logged = log.lines().empty() ? "" : log.lines().front();
        EXPECT_EQ(logged.substr(0, std::string(c.log).size()), c.log);
        EXPECT_EQ(log.lines().size(), *c.log ? 1u : 0u) << c.name;
        g_object_unref(object);
    }
    EXPECT_TRUE(nameHasOwner(DBUS_BUS_SESSION, "org.btbus.Free"));
    dbus_connection_close(owner);
    dbus_connection_unref(owner);
}

TEST(AServerObject, RunsNoLoopUnlessItIsAScannerServer) {
    ServerObject plain("org.btbus.Plain", "/org/btbus/Plain", DBUS_BUS_SESSION);
    Clock::time_point start = Clock::now();
    plain.startLoop();
    plain.quitLoop();
    EXPECT_LT(Clock::now() - start, scaled(1s));
    EXPECT_STREQ(plain.getBusName(), "org.freedesktop.DBus");
    EXPECT_STREQ(plain.getPath(), "/org/freedesktop/DBus");
    EXPECT_EQ(std::string(plain.getConnectionName()).substr(0, 1), ":");
}

// Runs in a child process of its own, which may hold a ScannerServer.
TEST(AScannerServer, IgnoresASecondStartLoopAndQuitsWhenAskedFromAnotherThread) {
    if (childRole() != "server") {
        EXPECT_EQ(runInChild("AScannerServer.*", "server"), 0);
        return;
    }
    ASSERT_TRUE(sim::start());
    struct Ticking : ScannerServer {
        std::atomic<int> ticks{ 0 };
        bool callbackThreadHandler(void* data) override {
            ++ticks;
            return ScannerServer::callbackThreadHandler(data);
        }
        size_t foundersNow() { return founders->size(); }
        int countdownNow() { return countdown; }
    } server;
    // Every addAdapterFounder starts discovery and counts down from 30 again,
    // also for an adapter that has a finder already.
    const std::string started = sim::defaultAdapterPath() + " org.bluez.Adapter.StartDiscovery()";
    sim::clearCallLog();
    for (size_t round = 1; round <= 2; ++round) {
        server.addAdapterFounder("hci0");
        EXPECT_EQ(server.foundersNow(), round);
        EXPECT_EQ(server.countdownNow(), 30);
        EXPECT_TRUE(waitUntil([&] { return sim::logLinesWith(started).size() == round; }));
        server.callbackThreadHandler(nullptr);
    }
    server.ticks = 0;
    std::thread loop([&] { server.startLoop(); });
    EXPECT_TRUE(waitUntil([&] { return server.ticks > 0; }));
    Clock::time_point start = Clock::now();
    server.startLoop();
    EXPECT_LT(Clock::now() - start, scaled(500ms));
    server.quitLoop();
    loop.join();
}

}  // namespace
