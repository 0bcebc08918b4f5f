// Every proxy operation without a bus (the unit tests' bus addresses lead
// nowhere, so every proxy has a null connection): the result, the error state
// and the one log line at the operation's own file and line.
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

// The log lines of the proxies' own files (the core's connection lines aside).
std::vector<std::string> proxyLines(const LogCapture& log) {
    std::vector<std::string> lines;
    for (const std::string& line : log.lines())
        if (line.compare(0, 15, "connection.cpp:") != 0) lines.push_back(line);
    return lines;
}

struct Case {
    const char* name;
    RemoteObject* object;
    std::function<bool()> run;  // true when the result says failure
    std::string logPrefix;      // "" when nothing may be logged
};

TEST(AProxyWithoutABus, FailsEveryOperationAndLogsItOnceAtItsOwnLine) {
    Agent agent;
    const Variant on(true);
    bool connected = true;
    Manager manager;
    Adapter adapter(kAdapterPath);
    Device device(kDevicePath);
    Audio audio(kDevicePath);
    AudioSink sink(kDevicePath);
    Control control(kDevicePath);
    const std::vector<Case> cases = {
        { "getProperties", &device, [&] { return device.getProperties() == nullptr; }, "bluez_object.cpp:77 " },
        { "setProperty", &device, [&] { return device.setProperty("Trusted", on) == -1; }, "bluez_object.cpp:107 " },
        { "defaultAdapter", &manager, [&] { return manager.defaultAdapter() == nullptr; }, "manager.cpp:96 " },
        { "findAdapter", &manager, [&] { return manager.findAdapter("hci0") == nullptr; }, "manager.cpp:156 " },
        { "getAdapterByIndex", &manager, [&] { return manager.getAdapterByIndex(0) == nullptr; },
          "manager.cpp:126 " },
        { "listAdapters", &manager, [&] { return manager.listAdapters() == nullptr; }, "" },
        { "requestSession", &adapter, [&] { return adapter.requestSession() == -1; }, "adapter.cpp:83 " },
        { "releaseSession", &adapter, [&] { return adapter.releaseSession() == -1; }, "adapter.cpp:105 " },
        { "startDiscovery", &adapter, [&] { return adapter.startDiscovery() == -1; }, "adapter.cpp:127 " },
        { "stopDiscovery", &adapter, [&] { return adapter.stopDiscovery() == -1; }, "adapter.cpp:149 " },
        { "findDevice logged", &adapter, [&] { return adapter.findDevice("00:11:22:33:44:55", true) == nullptr; },
          "adapter.cpp:180 " },
        { "findDevice quiet", &adapter, [&] { return adapter.findDevice("00:11:22:33:44:55", false) == nullptr; },
          "" },
        { "listDevices", &adapter, [&] { return adapter.listDevices() == nullptr; }, "adapter.cpp:212 " },
        { "getDeviceByIndex", &adapter, [&] { return adapter.getDeviceByIndex(0) == nullptr; }, "adapter.cpp:243 " },
        { "createDevice", &adapter, [&] { return adapter.createDevice("00:11:22:33:44:55") == nullptr; },
          "adapter.cpp:274 " },
        { "cancelDeviceCreation", &adapter, [&] { return adapter.cancelDeviceCreation("00:11:22:33:44:55") == -1; },
          "adapter.cpp:337 " },
        { "removeDevice", &adapter, [&] { return adapter.removeDevice(kDevicePath) == -1; }, "adapter.cpp:363 " },
        { "adapter getProperties", &adapter, [&] { return adapter.getProperties() == nullptr; },
          "bluez_object.cpp:77 " },
        { "discoverServices", &device, [&] { return device.discoverServices("") == nullptr; }, "device.cpp:64 " },
        { "cancelDiscovery", &device, [&] { return device.cancelDiscovery() == -1; }, "device.cpp:85 " },
        { "Audio::connect", &audio, [&] { return audio.connect() == -1; }, "audio.cpp:51 " },
        { "Audio::disconnect", &audio, [&] { return audio.disconnect() == -1; }, "audio.cpp:73 " },
        { "AudioSink::connect", &sink, [&] { return sink.connect() == -1; }, "audio_sink.cpp:58 " },
        { "AudioSink::disconnect", &sink, [&] { return sink.disconnect() == -1; }, "audio_sink.cpp:80 " },
        { "AudioSink::isConnected", &sink, [&] { return sink.isConnected(connected) == -1; }, "audio_sink.cpp:106 " },
        { "Control::isConnected", &control, [&] { return control.isConnected(connected) == -1; }, "control.cpp:60 " },
        { "volumeDown", &control, [&] { return control.volumeDown() == -1; }, "control.cpp:82 " },
        { "volumeUp", &control, [&] { return control.volumeUp() == -1; }, "control.cpp:105 " },
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        LogCapture log;
        EXPECT_TRUE(c.run());
        EXPECT_TRUE(c.object->hasError());
        std::vector<std::string> lines = proxyLines(log);
        if (c.logPrefix.empty()) {
            EXPECT_TRUE(lines.empty()) << lines.front();
        } else {
            ASSERT_EQ(lines.size(), 1u);
            EXPECT_EQ(lines[0], c.logPrefix + c.object->getErrorMessage());
        }
    }
    EXPECT_TRUE(connected) << "isConnected wrote its answer although it failed";
}

TEST(AProxyWithoutABus, RefusesNullAndMalformedArgumentsBeforeSending) {
    LogCapture log;
    Adapter adapter(kAdapterPath);
    EXPECT_EQ(adapter.findDevice(nullptr, true), nullptr);
    EXPECT_EQ(adapter.getErrorNumber(), 1);
    EXPECT_EQ(adapter.removeDevice(nullptr), -1);
    EXPECT_EQ(adapter.getErrorNumber(), 1);
    EXPECT_EQ(adapter.removeDevice("org/bluez/77/hci0/dev_00_11_22_33_44_55"), -1);
    EXPECT_EQ(adapter.getErrorNumber(), 3);
    Agent unregistered;  // its path is still empty
    EXPECT_EQ(adapter.createPairedDevice("00:11:22:33:44:55", unregistered), nullptr);
    EXPECT_EQ(adapter.getErrorNumber(), 3);
    EXPECT_EQ(adapter.registerAgent(unregistered), -1);
    EXPECT_EQ(adapter.getErrorNumber(), 3);
    EXPECT_EQ(adapter.unregisterAgent(unregistered), -1);
    Manager manager;
    EXPECT_EQ(manager.findAdapter(nullptr), nullptr);
    EXPECT_EQ(manager.getErrorNumber(), 1);
    Device device(kDevicePath);
    EXPECT_EQ(device.setProperty(nullptr, Variant(true)), -1);
    EXPECT_EQ(device.getErrorNumber(), 1);
    EXPECT_EQ(device.setProperty("Alias", Variant(-5)), -1);  // signed numbers cannot be written
    EXPECT_EQ(device.getErrorNumber(), 9);
    EXPECT_EQ(device.discoverServices(nullptr), nullptr);
    EXPECT_EQ(device.getErrorNumber(), 1);
    const std::vector<std::string> expected = {
        "adapter.cpp:180 Parameter is null", "adapter.cpp:363 Parameter is null",
        "adapter.cpp:363 Invalid path",      "adapter.cpp:312 Invalid path",
        "adapter.cpp:393 Invalid path",      "adapter.cpp:419 Invalid path",
        "manager.cpp:156 Parameter is null", "bluez_object.cpp:107 Parameter is null",
        "bluez_object.cpp:107 Failed to open container", "device.cpp:64 Parameter is null",
    };
    EXPECT_EQ(proxyLines(log), expected);
}

TEST(AProxyWithoutABus, StartsANewOperationWithAClearedErrorState) {
    Control control(kDevicePath);
    bool connected = false;
    EXPECT_EQ(control.isConnected(connected), -1);
    EXPECT_EQ(control.getErrorNumber(), 11);
    EXPECT_EQ(control.volumeUp(), -1);
    EXPECT_EQ(control.getErrorNumber(), 10) << "volumeUp kept the error of isConnected";
}

TEST(TheFactoriesWithoutABus, ReturnNullAndListNamesGivesAnEmptyList) {
    LogCapture log;
    EXPECT_FALSE(BluezObject::hasBluetoothd());
    EXPECT_EQ(Manager::getManager(), nullptr);
    EXPECT_EQ(Adapter::getAdapter(kAdapterPath), nullptr);
    EXPECT_EQ(Device::getDevice(kDevicePath), nullptr);
    EXPECT_EQ(Audio::getAudio(kDevicePath), nullptr);
    EXPECT_EQ(AudioSink::getAudioSink(kDevicePath), nullptr);
    EXPECT_EQ(Control::getControl(kDevicePath), nullptr);
    EXPECT_EQ(log.count("dbus_object.cpp:42 No connection to the bus"), 7u);
    DBusObject bus;
    std::unique_ptr<std::vector<std::string> > names(bus.listNames());
    ASSERT_NE(names, nullptr);
    EXPECT_TRUE(names->empty());
    EXPECT_EQ(bus.getErrorNumber(), 11);
}

}  // namespace
