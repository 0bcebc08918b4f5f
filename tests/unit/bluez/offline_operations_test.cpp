// Proxy operations without a bus (the unit tests' bus addresses lead nowhere), or given a null: the
// result and the one log line at the operation's own file and line.
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "support/log_capture.h"

namespace {

using namespace Bluetooth;
using btbus_test::LogCapture;

const char kAdapterPath[] = "/org/bluez/77/hci0";
const char kDevicePath[] = "/org/bluez/77/hci0/dev_00_11_22_33_44_55";

TEST(AProxyWithoutABus, FailsEveryOperationAndLogsItOnceAtItsOwnLine) {
    const std::string wait = "No connection to the bus", send = "Failed to send message", null = "Parameter is null";
    Agent unregistered;  // its path is still empty
    Manager manager;
    Adapter adapter(kAdapterPath);
    Device device(kDevicePath);
    Audio audio(kDevicePath);
    AudioSink sink(kDevicePath);
    Control control(kDevicePath);
    bool connected = true;  // a failed query leaves the answer as it was
    const struct {
        std::function<bool()> failed;
        std::string at, message;
    } cases[] = {
        { [&] { return device.getProperties() == nullptr; }, "bluez_object.cpp:77", wait },
        { [&] { return device.setProperty(nullptr, Variant(true)) == -1; }, "bluez_object.cpp:107", null },
        { [&] { return manager.getAdapterByIndex(0) == nullptr; }, "manager.cpp:126", wait },
        { [&] { return manager.findAdapter(nullptr) == nullptr; }, "manager.cpp:156", null },
        { [&] { return adapter.requestSession() == -1; }, "adapter.cpp:83", send },
        { [&] { return adapter.releaseSession() == -1; }, "adapter.cpp:105", send },
        { [&] { return adapter.startDiscovery() == -1; }, "adapter.cpp:127", send },
        { [&] { return adapter.stopDiscovery() == -1; }, "adapter.cpp:149", send },
        { [&] { return adapter.findDevice(nullptr, true) == nullptr; }, "adapter.cpp:180", null },
        { [&] { return adapter.listDevices() == nullptr; }, "adapter.cpp:212", wait },
        { [&] { return adapter.getDeviceByIndex(0) == nullptr; }, "adapter.cpp:243", wait },
        { [&] { return adapter.cancelDeviceCreation("00:11:22:33:44:55") == -1; }, "adapter.cpp:337", send },
        { [&] { return adapter.removeDevice(nullptr) == -1; }, "adapter.cpp:363", null },
        { [&] { return adapter.registerAgent(unregistered) == -1; }, "adapter.cpp:393", "Invalid path" },
        { [&] { return adapter.unregisterAgent(unregistered) == -1; }, "adapter.cpp:419", "Invalid path" },
        { [&] { return device.discoverServices(nullptr) == nullptr; }, "device.cpp:64", null },
        { [&] { return device.cancelDiscovery() == -1; }, "device.cpp:85", send },
        { [&] { return audio.connect() == -1; }, "audio.cpp:51", send },
        { [&] { return audio.disconnect() == -1; }, "audio.cpp:73", send },
        { [&] { return sink.connect() == -1; }, "audio_sink.cpp:58", send },
        { [&] { return sink.disconnect() == -1; }, "audio_sink.cpp:80", send },
        { [&] { return sink.isConnected(connected) == -1 && connected; }, "audio_sink.cpp:106", wait },
        { [&] { return control.isConnected(connected) == -1 && connected; }, "control.cpp:60", wait },
        { [&] { return control.volumeDown() == -1; }, "control.cpp:82", send },
        { [&] { return control.volumeUp() == -1; }, "control.cpp:105", send },
    };
    for (const auto& c : cases) {
        LogCapture log;
        EXPECT_TRUE(c.failed()) << c.at;
        EXPECT_EQ(log.lines(), std::vector<std::string>{ c.at + " " + c.message });
    }
}

// Each factory asks hasBluetoothd first, as their tests over the bus show.
TEST(TheFactoriesWithoutABus, ReturnNullLoggingTheMissingBusAndListNamesGivesAnEmptyList) {
    LogCapture log;
    EXPECT_FALSE(BluezObject::hasBluetoothd());
    EXPECT_EQ(Manager::getManager(), nullptr);
    EXPECT_EQ(log.count("dbus_object.cpp:42 No connection to the bus"), 2u);
    DBusObject bus;
    std::unique_ptr<std::vector<std::string> > names(bus.listNames());
    ASSERT_NE(names, nullptr);
    EXPECT_TRUE(names->empty());
    EXPECT_EQ(bus.getErrorNumber(), 11);
}

// Notes its path when deleted, to see which elements a list deletes and when.
template <typename Base>
struct Tracked : Base {
    Tracked(const char* path, std::vector<std::string>& deleted) : Base(path), deleted(deleted) {}
    ~Tracked() override { deleted.push_back(this->getPath()); }
    std::vector<std::string>& deleted;
};

template <typename List, typename Element>
void expectOwnsElementsFrontToBackSkippingNull() {
    std::vector<std::string> deleted;
    List* list = new List;
    list->insert(list->end(), { new Tracked<Element>("/a", deleted), nullptr, new Tracked<Element>("/b", deleted) });
    delete list;
    EXPECT_EQ(deleted, (std::vector<std::string>{ "/a", "/b" }));
}

TEST(TheAdapterAndDeviceLists, DeleteTheirElementsFrontToBackSkippingNullOnes) {
    expectOwnsElementsFrontToBackSkippingNull<AdapterList, Adapter>();
    expectOwnsElementsFrontToBackSkippingNull<DeviceList, Device>();
}

TEST(AScannerServerWithoutBluetoothd, LogsThatItHasNoManagerAndIsNotReady) {
    LogCapture log;
    { Bluetooth::ScannerServer server; }
    EXPECT_EQ(log.count("scanner_server.cpp:262 failed to get manager"), 1u) << ::testing::PrintToString(log.lines());
    EXPECT_EQ(log.count("scanner_server.cpp:224 Failed to initial the ScannerServer"), 1u);
}

}  // namespace
