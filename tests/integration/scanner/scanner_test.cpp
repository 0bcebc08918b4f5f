// btbus-scanner against bluez4-sim, started by the test or by the session bus and asked through the
// Scanner client, raw calls and third-party clients; and the service object base beneath it.
#include <atomic>
#include <future>
#include <map>
#include <memory>
#include <set>
#include <thread>

#include <sys/wait.h>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "core/dbus_holders.h"
#include "core/decode.h"
#include "support/log_capture.h"
#include "support/private_buses.h"
#include "support/process.h"
#include "support/sim.h"

namespace {

using namespace btbus_test;
using namespace Bluetooth;
using namespace Bluetooth::internal;
using Clock = std::chrono::steady_clock;
using Texts = std::map<std::string, std::string>;

const char kName[] = "com.quillmar.bluetooth", kInterface[] = "com.quillmar.bluetooth.Scanner";
const char kAddress[] = "00:11:22:33:44:55";

bool scannerRuns() { return nameHasOwner(DBUS_BUS_SESSION, kName); }

// The scanner's a{ss} answer in full (the empty key included) or its error.
struct Answer { Texts devices; std::string errorName, error; };

// A call to the scanner with one string argument, on a connection of its own
// so that the library's shared one is not involved. Without wait the caller
// leaves before the answer.
Answer callScanner(const char* method, const std::string& argument, bool wait = true) {
    ScopedError error;
    DBusConnection* connection = dbus_bus_get_private(DBUS_BUS_SESSION, error.get());
    if (connection == nullptr) return Answer{ {}, error.name(), error.text() };
    dbus_connection_set_exit_on_disconnect(connection, FALSE);
    MessagePtr call(dbus_message_new_method_call(kName, "/", kInterface, method)), reply;
    const char* text = argument.c_str();
    dbus_message_append_args(call.get(), DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID);
    if (wait) reply.reset(dbus_connection_send_with_reply_and_block(connection, call.get(), -1, error.get()));
    if (!wait) dbus_connection_send(connection, call.get(), nullptr);
    dbus_connection_flush(connection);
    dbus_connection_close(connection);
    dbus_connection_unref(connection);
    Answer answer{ {}, error.name(), error.text() };
    DBusMessageIter args, array, entry;
    if (reply && dbus_message_iter_init(reply.get(), &args) && typeOf(args) == DBUS_TYPE_ARRAY)
        for (dbus_message_iter_recurse(&args, &array); typeOf(array) != DBUS_TYPE_INVALID; dbus_message_iter_next(&array)) {
            dbus_message_iter_recurse(&array, &entry);
            std::string key = readText(entry);
            dbus_message_iter_next(&entry);
            answer.devices[key] = readText(entry);
        }
    return answer;
}

// Generous: every answer takes a round of blocking calls to BlueZ.
bool listsExactly(const std::string& adapter, const std::set<std::string>& expected) {
    return waitUntil([&] {
        std::set<std::string> listed;
        for (const auto& device : callScanner("ListDevices", adapter).devices) listed.insert(device.first);
        return listed == expected;
    }, 20s);
}

// DeviceFound from adapterPath; props is the a{sv} as the simulator's JSON.
void found(const std::string& adapterPath, const std::string& address, const std::string& props) {
    sim::emitSignal(adapterPath, "org.bluez.Adapter", "DeviceFound", "sa{sv}", "[\"" + address + "\", " + props + "]");
}

// Scanner::listDevices's result, released as its caller must: the list and every Dict in it.
struct ReleaseDevices {
    template <typename List> void operator()(List* devices) const { for (auto& device : *devices) delete device.second; delete devices; }
};
using Devices = std::unique_ptr<std::vector<std::pair<std::string, Dict*> >, ReleaseDevices>;

// btbus-scanner as the session bus starts it on a test's first call; ended after each test.
class AScanner : public SimTest {
protected:
    void TearDown() override {
        std::string pid = shell("gdbus call --session --dest org.freedesktop.DBus --object-path /org/freedesktop/DBus "
                                "--method org.freedesktop.DBus.GetConnectionUnixProcessID com.quillmar.bluetooth");
        if (pid.rfind("(uint32 ", 0) == 0) kill(std::stoi(pid.substr(8)), SIGTERM);
        EXPECT_TRUE(waitUntil([] { return !scannerRuns(); }, 10s));
    }
};

// The one test that waits for the idle exit. The ticks drift late on a loaded
// machine; an exit postponed by the second call would come 50 s after the first.
TEST_F(AScanner, AsksNothingForAnAdapterBluezLacksAndIsGoneThirtySecondsAfterTheLastFinder) {
    Scanner scanner;
    LogCapture log;
    EXPECT_FALSE(scanner.removeFinder("hci9"));
    EXPECT_EQ(scanner.listDevices("hci9", true), nullptr);
    EXPECT_FALSE(scannerRuns());  // a call would have started it
    EXPECT_EQ(log.count("manager.cpp:156 No such adapter"), 2u) << ::testing::PrintToString(log.lines());
    Clock::time_point created = Clock::now();
    ASSERT_NE(Devices(scanner.listDevices("hci0", true)), nullptr);
    std::this_thread::sleep_for(20s);
    ASSERT_NE(Devices(scanner.listDevices("hci0", true)), nullptr);  // does not postpone the exit
    ASSERT_TRUE(waitUntil([] { return !scannerRuns(); }, 25s));
    EXPECT_GT(std::chrono::duration<double>(Clock::now() - created).count(), 29.0);
    EXPECT_TRUE(scanner.removeFinder("hci0"));  // started again
    EXPECT_TRUE(waitUntil(&scannerRuns, 10s));
    sim::kill();
    EXPECT_FALSE(scanner.removeFinder("hci0"));
    EXPECT_EQ(scanner.listDevices("hci0", true), nullptr);
}

// btbus-scanner started by the test; it exits with 0 on SIGTERM.
class AScannerDaemon : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        daemon = spawn(targetCommand({ BTBUS_SCANNER }));
        ASSERT_TRUE(waitForName(DBUS_BUS_SESSION, kName));
    }
    void TearDown() override {
        EXPECT_EQ(stop(daemon, SIGTERM, 10s), 0) << "btbus-scanner did not exit with 0";
        EXPECT_TRUE(waitUntil([] { return !scannerRuns(); }));
    }
    pid_t daemon = -1;
};

// The mouse of the scene, paired, is one of BlueZ's device objects: never
// listed. A bluetoothd that hangs and goes ends a waiting ListDevices with an
// error; a new one has new adapter paths and knows nothing the old one
// found; an adapter it lacks leaves its finder empty until it comes.
TEST_F(AScannerDaemon, FollowsDiscoveryPairingRangeAndANewBluetoothd) {
    using sim::kHeadset, sim::kKeyboard, sim::kPhone;
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard, kPhone }));
    delete std::unique_ptr<Adapter>(Adapter::getAdapter(sim::defaultAdapterPath().c_str()))->createDevice(kPhone);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard }));
    sim::setInRange("hci0", kKeyboard, false);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset }));
    sim::setInRange("hci0", kKeyboard, true);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard }));
    EXPECT_EQ(callScanner("ListDevices", "hci1").error, "");
    // A bluetoothd that hangs, then goes, ends a ListDevices that waits for it with an error.
    sim::freeze(true);
    auto waiting = std::async(std::launch::async, [] { return callScanner("ListDevices", "hci0"); });
    sim::kill();
    ASSERT_EQ(waiting.wait_for(scaled(10s)), std::future_status::ready);
    EXPECT_NE(waiting.get().errorName, "");
    ASSERT_TRUE(sim::start());
    sim::setInRange("hci0", kKeyboard, false);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kPhone }));  // found by discovery on the new hci0
    EXPECT_EQ(callScanner("ListDevices", "hci1").error, "Adapter hci1 not found");
    hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    EXPECT_TRUE(sim::waitForLogLine(hci1 + " org.bluez.Adapter.StartDiscovery()"));
}

// Raw calls and third-party clients alike; the Scanner client reads the texts as strings.
TEST_F(AScannerDaemon, ListsTheLatestTextsRemovesFindersAndAnswersErrorsWithTheCallersArgument) {
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    // Per tool: its call up to the method, and up to the argument; what it prints
    // for ListDevices without devices, and for RemoveFinder.
    const std::string tools[][4] = {
        { "gdbus call --session --dest com.quillmar.bluetooth --object-path / --method com.quillmar.bluetooth.Scanner.",
          " ", "({'': ''},)", "()\n" },
        { "busctl --address=\"$DBUS_SESSION_BUS_ADDRESS\" call com.quillmar.bluetooth / com.quillmar.bluetooth.Scanner ",
          " s ", "a{ss} 1 \"\" \"\"", "" },
        { "dbus-send --session --print-reply --dest=com.quillmar.bluetooth / com.quillmar.bluetooth.Scanner.", " string:",
          "array [\n      dict entry(\n         string \"\"\n         string \"\"", "method return" },
    };
    const char* cases[][3] = {  // method, argument, error ("" for success)
        { "ListDevices", "hci9 %s%n", "Adapter hci9 %s%n not found" },
        // False without an error of its own: the bindings' words.
        { "RemoveFinder", "hci9", "Method invoked for RemoveFinder returned FALSE but did not set error" },
        { "RemoveFinder", "", "Scanner or AdapterId is null" },
        { "RemoveFinder", "hci1", "" },  // no finder yet
        { "ListDevices", "hci1", "" },
        { "RemoveFinder", "00:1A:7D:DA:71:99", "" },  // hci1 by its address
        { "ListDevices", "hci1", "" },
        { "RemoveFinder", "hci1", "" },
    };
    for (const auto& c : cases) {
        EXPECT_EQ(callScanner(c[0], c[1]).error, c[2]) << c[0] << "(" << c[1] << ")";
        for (int tool = 0; tool < 3; ++tool) {
            std::string expected = *c[2] ? c[2] : tools[tool][std::string(c[0]) == "ListDevices" ? 2 : 3];
            std::string output = shell(tools[tool][0] + c[0] + tools[tool][1] + "'" + c[1] + "'");
            EXPECT_NE(output.find(expected), std::string::npos) << tools[tool][0] << c[0] << "(" << c[1] << "):\n" << output;
            if (expected.empty()) EXPECT_EQ(output, "") << tools[tool][0] << c[0];
        }
    }
    std::string introspection = shell("gdbus introspect --session --dest com.quillmar.bluetooth --object-path /");
    EXPECT_NE(introspection.find("ListDevices(in  s arg0,\n                  out a{ss} arg1);"), std::string::npos) << introspection;
    EXPECT_NE(introspection.find("RemoveFinder(in  s arg0);"), std::string::npos) << introspection;
    EXPECT_EQ(callScanner("RemoveFinder", "hci9").errorName, "org.freedesktop.DBus.GLib.ErrorError");
    const std::string adapter = hci1 + " org.bluez.Adapter.";
    EXPECT_EQ(sim::logLinesWith(adapter + "StartDiscovery()").size(), 2u);
    EXPECT_EQ(sim::logLinesWith(adapter + "StopDiscovery()").size(), 2u);

    // A device found on the removed finder's adapter creates the finder again.
    // Each DeviceFound replaces the text; one with no properties leaves it empty.
    const std::string silent = "00:11:22:33:44:66";
    found(hci1, silent, "{}");
    found(hci1, kAddress, R"({"Address": ["s", "00:11:22:33:44:55"], "Paired": ["b", false]})");
    found(hci1, kAddress, R"({"Address": ["s", "00:11:22:33:44:55"], "RSSI": ["n", -60]})");
    Texts expected = { { kAddress, "Address: 00:11:22:33:44:55;RSSI: -60;" }, { silent, "" } };
    EXPECT_TRUE(waitUntil([&] { return callScanner("ListDevices", "hci1").devices == expected; }, 10s));
    EXPECT_EQ(sim::logLinesWith(adapter + "StartDiscovery()").size(), 3u);
    Scanner scanner;
    Devices devices(scanner.listDevices("hci1", true));
    ASSERT_TRUE(devices && devices->size() == 1u) << scanner.getErrorMessage();  // the empty text left out
    EXPECT_EQ(devices->front().first, kAddress);
    EXPECT_EQ(dictToString(*devices->front().second), std::string("Address: ") + kAddress + "\nRSSI: -60\n");
    for (const Entry& entry : *devices->front().second) EXPECT_EQ(entry.second.which(), 3) << entry.first;  // strings
}

TEST_F(AScannerDaemon, SurvivesBadSignalsVanishingClientsAndAStormBesideEightClients) {
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    Scanner scanner;
    Devices none(scanner.listDevices("hci1", true));
    ASSERT_NE(none, nullptr) << scanner.getErrorMessage();
    EXPECT_TRUE(none->empty());  // the answer's one entry "" to "" holds no separator
    const std::string longText(10000, 'x');
    const std::string bad[][3] = {  // member, signature, arguments
        { "DeviceFound", "sa{sv}", R"(["A1", {"Address": ["d", 1.5]}])" },
        { "DeviceFound", "sa{sv}", R"(["A2", {"Nested": ["a{sv}", {"x": ["s", "y"]}], "Big": ["x", 5]}])" },
        { "DeviceFound", "sa{sv}", R"(["", {"Address": ["s", ""]}])" },
        { "DeviceFound", "sa{sv}", "[\"" + longText + "\", {\"Name\": [\"s\", \"long address\"]}]" },
        { "DeviceFound", "sa{sv}", "[\"A3\", {\"Name\": [\"s\", \"" + longText + "\"]}]" },
        { "DeviceDisappeared", "s", R"([""])" },
        { "DeviceFound", "ia{sv}", R"([7, {}])" },
        { "DeviceFound", "s", R"(["A4"])" },
    };
    for (const auto& signal : bad) sim::emitSignal(hci1, "org.bluez.Adapter", signal[0], signal[1], signal[2]);
    // A1 and A2 cannot be decoded, "" is no address: only the others are kept.
    std::set<std::string> expected = { "A3", longText };
    EXPECT_TRUE(listsExactly("hci1", expected));
    EXPECT_EQ(callScanner("ListDevices", "hci1").devices["A3"], "Name: " + longText + ";");
    for (int i = 0; i < 20; ++i) callScanner("ListDevices", "hci1", false);  // clients that leave before the answer

    DBusConnection* bus = dbus_bus_get_private(DBUS_BUS_SYSTEM, nullptr);
    ASSERT_NE(bus, nullptr);
    std::atomic<bool> storming{ true };
    std::atomic<int> failures{ 0 };
    std::vector<std::thread> clients;
    for (int i = 0; i < 8; ++i)
        clients.emplace_back([&] {
            for (int calls = 0; storming || calls < 3; ++calls) failures += !callScanner("ListDevices", "hci1").error.empty();
        });
    for (int i = 0; i < 2000; ++i) {  // sent raw: the simulator is too slow for a storm
        char address[18];
        const char* text = address;
        snprintf(address, sizeof address, "02:00:00:00:%02X:%02X", i / 256, i % 256);
        MessagePtr signal(dbus_message_new_signal(hci1.c_str(), "org.bluez.Adapter", "DeviceFound"));
        DBusMessageIter args, properties;
        dbus_message_iter_init_append(signal.get(), &args);
        dbus_message_iter_append_basic(&args, DBUS_TYPE_STRING, &text);
        dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "{sv}", &properties);
        dbus_message_iter_close_container(&args, &properties);
        dbus_connection_send(bus, signal.get(), nullptr);
        expected.insert(address);
        if (i % 100 == 0) dbus_connection_flush(bus);
    }
    dbus_connection_flush(bus);
    EXPECT_TRUE(listsExactly("hci1", expected));
    storming = false;
    for (std::thread& client : clients) client.join();
    dbus_connection_close(bus);
    dbus_connection_unref(bus);
    EXPECT_EQ(failures, 0);
}

// In a child of its own, whose session bus dies while a client asks.
TEST(TheScannerDaemon, SaysWhatItDoesStartsDiscoveryOnItsAdaptersAndEndsWithoutACrashWhenItsBusDies) {
    BTBUS_IN_OWN_PROCESS();
    std::string help = shell(targetShellCommand(BTBUS_SCANNER) + " --help");
    EXPECT_NE(help.find("com.quillmar.bluetooth on the session bus"), std::string::npos) << help;
    EXPECT_NE(shell(targetShellCommand(BTBUS_SCANNER) + " --bogus; echo status $?").find("status 2"), std::string::npos);
    ASSERT_TRUE(sim::start());
    pid_t daemon = spawn(targetCommand({ BTBUS_SCANNER, "hci9", "hci0" }));  // BlueZ lacks hci9
    ASSERT_TRUE(waitForName(DBUS_BUS_SESSION, kName));
    EXPECT_TRUE(sim::waitForLogLine(sim::defaultAdapterPath() + " org.bluez.Adapter.StartDiscovery()"));
    std::atomic<bool> asking{ true };
    std::thread client([&] {
        while (asking) callScanner("ListDevices", "hci0");
    });
    std::this_thread::sleep_for(300ms);
    PrivateBuses::killSessionBus();
    int status = 0;
    EXPECT_TRUE(waitUntil([&] { return waitpid(daemon, &status, WNOHANG) == daemon; }, 10s));
    EXPECT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
    asking = false;
    client.join();
}

// The base runs no loop of its own, and names the bus daemon's proxy.
TEST(AServerObject, ClaimsItsNameAlsoBehindAnotherOwnerAndLogsWhyItCannot) {
    DBusConnection* owner = dbus_bus_get_private(DBUS_BUS_SESSION, nullptr);
    ASSERT_NE(owner, nullptr);
    ASSERT_EQ(dbus_bus_request_name(owner, "org.btbus.Taken", 0, nullptr), DBUS_REQUEST_NAME_REPLY_PRIMARY_OWNER);
    static const DBusGObjectInfo info = { 1, nullptr, 0, "\0", "\0", "\0" };
    static GType type = g_type_register_static_simple(G_TYPE_OBJECT, "BtbusTestObject", sizeof(GObjectClass), nullptr,
                                                      sizeof(GObject), nullptr, GTypeFlags(0));
    const struct { const char* name; bool claimed; const char* log; } cases[] = {
        { "org.btbus.Free", true, "" },
        { "org.btbus.Taken", true, "" },  // queued
        { "not a name", false, "server_object.cpp:71 Failed to acquire not a name, " },
    };
    for (const auto& c : cases) {
        LogCapture log;
        ServerObject server(c.name, "/org/btbus/Test", DBUS_BUS_SESSION);
        GObject* object = static_cast<GObject*>(g_object_new(type, nullptr));
        EXPECT_EQ(server.prepareObjectInfo(type, &info, object), c.claimed) << c.name;
        ASSERT_EQ(log.lines().size(), *c.log ? 1u : 0u) << c.name;
        if (*c.log) EXPECT_EQ(log.lines()[0].rfind(c.log, 0), 0u) << log.lines()[0];
        g_object_unref(object);
        Clock::time_point start = Clock::now();
        server.startLoop();
        server.quitLoop();
        EXPECT_LT(Clock::now() - start, scaled(1s));
        EXPECT_STREQ(server.getBusName(), "org.freedesktop.DBus");
        EXPECT_STREQ(server.getPath(), "/org/freedesktop/DBus");
        EXPECT_EQ(server.getConnectionName()[0], ':');
    }
    dbus_connection_close(owner);
    dbus_connection_unref(owner);
}

// Runs in a child process of its own, which may hold a ScannerServer. Every
// addAdapterFounder starts discovery and counts down from 30 again, also for
// an adapter that has a finder already.
TEST(AScannerServer, AddsFoundersIgnoresASecondStartLoopAndQuitsWhenAskedFromAnotherThread) {
    BTBUS_IN_OWN_PROCESS();
    ASSERT_TRUE(sim::start());
    struct Peeking : ScannerServer {
        size_t foundersNow() { return founders->size(); }
        int countdownNow() { return countdown; }
    } server;
    const std::string started = sim::defaultAdapterPath() + " org.bluez.Adapter.StartDiscovery()";
    for (size_t round = 1; round <= 2; ++round) {
        server.callbackThreadHandler(nullptr);  // a tick that the founder takes back
        server.addAdapterFounder("hci0");
        EXPECT_EQ(server.foundersNow(), round);
        EXPECT_EQ(server.countdownNow(), 30);
        EXPECT_TRUE(waitUntil([&] { return sim::logLinesWith(started).size() == round; }));
    }
    std::thread loop([&] { server.startLoop(); });
    EXPECT_EQ(callScanner("ListDevices", "hci0").error, "");  // answered: the loop runs
    Clock::time_point start = Clock::now();
    server.startLoop();
    EXPECT_LT(Clock::now() - start, scaled(500ms));
    server.quitLoop();
    loop.join();
}

}  // namespace
