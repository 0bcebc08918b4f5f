// btbus-scanner against bluez4-sim, asked through raw calls and third-party
// clients: listing, filtering, finder removal, errors and bad input.
#include <atomic>
#include <memory>
#include <set>
#include <thread>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include <sys/wait.h>

#include "integration/scanner/scanner_peer.h"
#include "support/private_buses.h"
#include "support/sim.h"

namespace {

using namespace btbus_test;
namespace sim = btbus_test::sim;
using Devices = std::map<std::string, std::string>;

const char kAddress[] = "00:11:22:33:44:55";

std::set<std::string> addresses(const Devices& devices) {
    std::set<std::string> keys;
    for (const auto& device : devices) keys.insert(device.first);
    return keys;
}

// Generous: every answer takes a round of blocking calls to BlueZ.
bool listsExactly(const std::string& adapter, const std::set<std::string>& expected) {
    return waitUntil([&] { return addresses(callScanner("ListDevices", adapter).devices) == expected; }, 10s);
}

class AScannerDaemon : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        daemon = std::make_unique<Daemon>();
    }
    void TearDown() override { EXPECT_EQ(daemon->stop(), 0) << "btbus-scanner did not exit with 0"; }
    std::unique_ptr<Daemon> daemon;
};

TEST_F(AScannerDaemon, ListsFoundDevicesWithTheirLatestTextAndWithoutThoseBluezHolds) {
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    EXPECT_EQ(callScanner("ListDevices", "hci1").devices, (Devices{ { "", "" } }));
    EXPECT_TRUE(sim::waitForLogLine(hci1 + " org.bluez.Adapter.StartDiscovery()"));
    const struct {
        const char* props;
        const char* text;
    } rounds[] = {
        { R"({"Address": ["s", "00:11:22:33:44:55"], "Paired": ["b", false]})",
          "Address: 00:11:22:33:44:55;Paired: 0;" },
        { R"({"Address": ["s", "00:11:22:33:44:55"], "RSSI": ["n", -60]})", "Address: 00:11:22:33:44:55;RSSI: -60;" },
    };
    for (const auto& round : rounds) {
        found(hci1, sim::kMouse, round.props);  // the mouse is a device object of hci0's
        found(hci1, kAddress, round.props);
        Devices expected = { { kAddress, round.text } };
        EXPECT_TRUE(waitUntil([&] { return callScanner("ListDevices", "hci1").devices == expected; }, 10s))
            << round.text;
    }
}

TEST_F(AScannerDaemon, FollowsDiscoveryPairingAndDevicesGoingOutOfRange) {
    using sim::kHeadset, sim::kKeyboard, sim::kPhone;
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard, kPhone }));
    std::unique_ptr<Bluetooth::Adapter> adapter(Bluetooth::Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
    ASSERT_NE(adapter, nullptr);
    delete adapter->createDevice(kPhone);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard }));
    sim::setInRange("hci0", kKeyboard, false);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset }));
    sim::setInRange("hci0", kKeyboard, true);
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard }));
}

// A new bluetoothd has new adapter paths and has found nothing yet; an
// adapter it lacks leaves its finder empty until it comes.
TEST_F(AScannerDaemon, StartsOverOnTheAdaptersOfANewBluetoothd) {
    using sim::kHeadset, sim::kKeyboard, sim::kPhone;
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kKeyboard, kPhone }));
    callScanner("ListDevices", "hci1");
    found(hci1, kAddress, "{}");
    EXPECT_TRUE(listsExactly("hci1", { kAddress }));
    sim::kill();
    ASSERT_TRUE(sim::start());
    sim::setInRange("hci0", kKeyboard, false);
    EXPECT_TRUE(sim::waitForLogLine(sim::defaultAdapterPath() + " org.bluez.Adapter.StartDiscovery()"));
    EXPECT_TRUE(listsExactly("hci0", { kHeadset, kPhone }));
    EXPECT_EQ(callScanner("ListDevices", "hci1").error, "Adapter hci1 not found");
    hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    EXPECT_TRUE(sim::waitForLogLine(hci1 + " org.bluez.Adapter.StartDiscovery()"));
    EXPECT_EQ(callScanner("ListDevices", "hci1").devices, (Devices{ { "", "" } }));
}

TEST_F(AScannerDaemon, RemovesFindersAndAnswersErrorsWithTheCallersArgument) {
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    const struct {
        const char* method;
        const char* argument;
        const char* error;      // the text; "" for success
        const char* errorName;  // checked when given
    } cases[] = {
        { "ListDevices", "hci9 %s%n", "Adapter hci9 %s%n not found", nullptr },
        { "RemoveFinder", "hci9", "Method invoked for RemoveFinder returned FALSE but did not set error",
          "org.freedesktop.DBus.GLib.ErrorError" },  // false without an error text of its own
        { "RemoveFinder", "", "Scanner or AdapterId is null", nullptr },
        { "RemoveFinder", "hci1", "", nullptr },  // no finder yet
        { "ListDevices", "hci1", "", nullptr },
        { "RemoveFinder", "00:1A:7D:DA:71:99", "", nullptr },  // hci1 by its address
        { "ListDevices", "hci1", "", nullptr },
        { "RemoveFinder", "hci1", "", nullptr },
    };
    for (const auto& c : cases) {
        Answer answer = callScanner(c.method, c.argument);
        EXPECT_EQ(answer.error, c.error) << c.method << "(" << c.argument << ")";
        if (c.errorName != nullptr) EXPECT_EQ(answer.errorName, c.errorName);
    }
    const std::string adapter = hci1 + " org.bluez.Adapter.";
    EXPECT_EQ(sim::logLinesWith(adapter + "StartDiscovery()").size(), 2u);
    EXPECT_EQ(sim::logLinesWith(adapter + "StopDiscovery()").size(), 2u);
    // A device found on the removed finder's adapter creates the finder again.
    found(hci1, kAddress, "{}");
    EXPECT_TRUE(listsExactly("hci1", { kAddress }));
    EXPECT_EQ(sim::logLinesWith(adapter + "StartDiscovery()").size(), 3u);
}

TEST_F(AScannerDaemon, AnswersGdbusBusctlAndDbusSend) {
    sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    const std::string tools[] = {
        "gdbus call --session --dest com.quillmar.bluetooth --object-path / --method "
        "com.quillmar.bluetooth.Scanner.",
        "busctl --address=\"$DBUS_SESSION_BUS_ADDRESS\" call com.quillmar.bluetooth / "
        "com.quillmar.bluetooth.Scanner ",
        "dbus-send --session --print-reply --dest=com.quillmar.bluetooth / com.quillmar.bluetooth.Scanner.",
    };
    const struct {
        const char* call[3];  // per tool: method and argument
        const char* answer[3];
    } cases[] = {
        { { "ListDevices hci1", "ListDevices s hci1", "ListDevices string:hci1" },
          { "({'': ''},)", "a{ss} 1 \"\" \"\"", "array [\n      dict entry(\n         string \"\"\n         string \"\"" } },
        { { "ListDevices hci9", "ListDevices s hci9", "ListDevices string:hci9" },
          { "Adapter hci9 not found", "Adapter hci9 not found", "Adapter hci9 not found" } },
        { { "RemoveFinder ''", "RemoveFinder s ''", "RemoveFinder string:" },
          { "Scanner or AdapterId is null", "Scanner or AdapterId is null", "Scanner or AdapterId is null" } },
        { { "RemoveFinder hci1", "RemoveFinder s hci1", "RemoveFinder string:hci1" },
          { "()\n", "", "method return" } },
    };
    for (const auto& c : cases) {
        for (int tool = 0; tool < 3; ++tool) {
            std::string output = shell(tools[tool] + c.call[tool]);
            EXPECT_NE(output.find(c.answer[tool]), std::string::npos) << c.call[tool] << ":\n" << output;
            if (*c.answer[tool] == '\0') EXPECT_EQ(output, "") << c.call[tool];
        }
    }
    std::string introspection =
        shell("gdbus introspect --session --dest com.quillmar.bluetooth --object-path /");
    EXPECT_NE(introspection.find("ListDevices(in  s arg0,\n                  out a{ss} arg1);"), std::string::npos)
        << introspection;
    EXPECT_NE(introspection.find("RemoveFinder(in  s arg0);"), std::string::npos) << introspection;
}

// DeviceFound with address and no properties, sent raw on the system bus.
void emitFound(DBusConnection* connection, const std::string& path, const std::string& address) {
    Bluetooth::internal::MessagePtr signal(dbus_message_new_signal(path.c_str(), "org.bluez.Adapter", "DeviceFound"));
    DBusMessageIter args, dict;
    const char* text = address.c_str();
    dbus_message_iter_init_append(signal.get(), &args);
    dbus_message_iter_append_basic(&args, DBUS_TYPE_STRING, &text);
    dbus_message_iter_open_container(&args, DBUS_TYPE_ARRAY, "{sv}", &dict);
    dbus_message_iter_close_container(&args, &dict);
    dbus_connection_send(connection, signal.get(), nullptr);
}

TEST_F(AScannerDaemon, SurvivesBadSignalsVanishingClientsAndAStormBesideEightClients) {
    std::string hci1 = sim::addAdapter("hci1", "00:1A:7D:DA:71:99");
    ASSERT_EQ(callScanner("ListDevices", "hci1").error, "");
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
    EXPECT_TRUE(listsExactly("hci1", { "A3", longText }));
    EXPECT_EQ(callScanner("ListDevices", "hci1").devices["A3"], "Name: " + longText + ";");

    // Clients that leave before their answer.
    for (int i = 0; i < 20; ++i) {
        DBusConnection* client = dbus_bus_get_private(DBUS_BUS_SESSION, nullptr);
        ASSERT_NE(client, nullptr);
        Bluetooth::internal::MessagePtr call(
            dbus_message_new_method_call(kScannerName, "/", kScannerInterface, "ListDevices"));
        const char* adapter = "hci1";
        dbus_message_append_args(call.get(), DBUS_TYPE_STRING, &adapter, DBUS_TYPE_INVALID);
        dbus_connection_send(client, call.get(), nullptr);
        dbus_connection_flush(client);
        dbus_connection_close(client);
        dbus_connection_unref(client);
    }

    const int kStorm = 2000;
    std::atomic<bool> storming{ true };
    std::atomic<int> failures{ 0 };
    std::vector<std::thread> clients;
    for (int i = 0; i < 8; ++i)
        clients.emplace_back([&] {
            for (int calls = 0; storming || calls < 3; ++calls)
                if (!callScanner("ListDevices", "hci1").error.empty()) ++failures;
        });
    DBusConnection* bus = dbus_bus_get_private(DBUS_BUS_SYSTEM, nullptr);
    ASSERT_NE(bus, nullptr);
    std::set<std::string> expected = { "A3", longText };
    for (int i = 0; i < kStorm; ++i) {
        char address[18];
        snprintf(address, sizeof address, "02:00:00:00:%02X:%02X", i / 256, i % 256);
        emitFound(bus, hci1, address);
        expected.insert(address);
        if (i % 100 == 0) dbus_connection_flush(bus);
    }
    dbus_connection_flush(bus);
    EXPECT_TRUE(waitUntil([&] { return addresses(callScanner("ListDevices", "hci1").devices) == expected; }, 20s));
    storming = false;
    for (std::thread& client : clients) client.join();
    dbus_connection_close(bus);
    dbus_connection_unref(bus);
    EXPECT_EQ(failures, 0);
}

// In a child of its own, whose session bus dies while a client asks.
TEST(TheScannerDaemon, EndsWithoutACrashWhenItsSessionBusDies) {
    if (childRole() != "bus-dies") {
        EXPECT_EQ(runInChild("TheScannerDaemon.EndsWithoutACrash*", "bus-dies"), 0);
        return;
    }
    ASSERT_TRUE(sim::start());
    pid_t daemon = spawn(targetCommand({ BTBUS_SCANNER, "hci0" }));
    ASSERT_TRUE(waitForName(DBUS_BUS_SESSION, kScannerName));
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

TEST(TheScannerDaemon, SaysWhatItDoesAndStartsDiscoveryForTheAdaptersItIsGiven) {
    std::string help = shell(targetShellCommand(BTBUS_SCANNER) + " --help");
    EXPECT_NE(help.find("com.quillmar.bluetooth on the session bus"), std::string::npos) << help;
    EXPECT_NE(help.find("thirty seconds after the last discovery"), std::string::npos) << help;
    EXPECT_NE(shell(targetShellCommand(BTBUS_SCANNER) + " --bogus; echo status $?").find("status 2"), std::string::npos);
    ASSERT_TRUE(sim::start());
    Daemon daemon({ "hci9", "hci0" });
    EXPECT_TRUE(sim::waitForLogLine(sim::defaultAdapterPath() + " org.bluez.Adapter.StartDiscovery()"));
    EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
