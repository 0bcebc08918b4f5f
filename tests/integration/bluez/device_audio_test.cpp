// Device, Audio, AudioSink and Control against bluez4-sim.
#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

#include "support/log_capture.h"
#include "support/process.h"
#include "support/sim.h"

namespace {

using namespace Bluetooth;
using btbus_test::LogCapture;
using btbus_test::SimTest;
using btbus_test::waitUntil;
namespace sim = btbus_test::sim;
using btbus_test::sim::kHeadset;
using btbus_test::sim::kMouse;

class ADevice : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        adapter.reset(Adapter::getAdapter(sim::defaultAdapterPath().c_str()));
        ASSERT_NE(adapter, nullptr);
    }
    std::unique_ptr<Adapter> adapter;
};

TEST_F(ADevice, DiscoversItsServicesAsRecordHandlesToRecordTexts) {
    std::unique_ptr<Device> mouse(Device::getDevice(sim::devicePath(kMouse).c_str()));
    ASSERT_NE(mouse, nullptr);
    std::unique_ptr<Dict> all(mouse->discoverServices(""));
    ASSERT_TRUE(all != nullptr);
    ASSERT_EQ(all->size(), 2u);  // HID and PnP records
    for (const Entry& record : *all) {
        EXPECT_NE(record.first.find_first_not_of("0123456789"), 0u) << "not a decimal handle";
        EXPECT_EQ(variantToString(record.second).compare(0, 5, "<?xml"), 0);
    }
    std::unique_ptr<Dict> hid(mouse->discoverServices("hid"));
    ASSERT_TRUE(hid != nullptr);
    EXPECT_EQ(hid->size(), 1u);
    std::unique_ptr<Dict> properties(mouse->getProperties());
    ASSERT_TRUE(properties != nullptr);
    EXPECT_EQ(Bluetooth::find(properties.get(), "Address"), kMouse);
    EXPECT_EQ(Bluetooth::find(properties.get(), "Paired"), "1");
}

TEST_F(ADevice, FailsAndLogsQueriesBluezCannotAnswerLeavingIsConnectedsAnswerUntouched) {
    sim::addDevice("hci0", R"({"address": "00:24:7E:00:00:01", "name": "Gone", "created": true,
                               "in_range": false})");
    std::unique_ptr<Device> gone(Device::getDevice(sim::devicePath("00:24:7E:00:00:01").c_str()));
    ASSERT_NE(gone, nullptr);
    LogCapture log;
    EXPECT_EQ(gone->discoverServices(""), nullptr);
    EXPECT_EQ(gone->getErrorNumber(), 11);
    EXPECT_EQ(gone->getErrorMessage(), "Host is down");
    std::unique_ptr<Device> mouse(Device::getDevice(sim::devicePath(kMouse).c_str()));
    EXPECT_EQ(mouse->discoverServices("no such service"), nullptr);
    std::unique_ptr<Device> missing(Device::getDevice("/org/bluez/nowhere"));
    EXPECT_EQ(missing->getProperties(), nullptr);
    // The mouse has no audio interfaces.
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(mouse->getPath()));
    std::unique_ptr<Control> control(Control::getControl(mouse->getPath()));
    bool connected = true;
    EXPECT_EQ(sink->isConnected(connected), -1);
    EXPECT_EQ(sink->getErrorNumber(), 11);
    EXPECT_EQ(control->isConnected(connected), -1);
    EXPECT_TRUE(connected);
    const std::vector<std::string> lines = log.lines();
    ASSERT_EQ(lines.size(), 5u);
    EXPECT_EQ(lines[0], "device.cpp:64 Host is down");
    EXPECT_EQ(lines[1], "device.cpp:64 Invalid arguments in method call");
    const char* const prefixes[] = { "bluez_object.cpp:77 ", "audio_sink.cpp:106 ", "control.cpp:60 " };
    for (int i = 0; i < 3; ++i) EXPECT_EQ(lines[2 + i].rfind(prefixes[i], 0), 0u) << lines[2 + i];
}

TEST_F(ADevice, SendsCancelDiscoveryAndATrustedFlagWithoutWaiting) {
    std::string path = sim::devicePath(kMouse);
    std::unique_ptr<Device> mouse(Device::getDevice(path.c_str()));
    LogCapture log;
    EXPECT_EQ(mouse->cancelDiscovery(), 0);  // refused: none running
    EXPECT_EQ(mouse->setProperty("Trusted", Variant(false)), 0);
    EXPECT_EQ(mouse->setProperty("Alias", Variant(3u)), 0);  // refused: wrong type
    EXPECT_EQ(mouse->setProperty("Alias", "kitchen-nas"), 0);  // text goes as a string
    ASSERT_TRUE(sim::waitForLogLine("SetProperty(Alias, kitchen-nas"));
    EXPECT_EQ(sim::logLinesWith(" org.bluez.Device."),
              (std::vector<std::string>{ path + " org.bluez.Device.CancelDiscovery()",
                                         path + " org.bluez.Device.SetProperty(Trusted, false)",
                                         path + " org.bluez.Device.SetProperty(Alias, 3)",
                                         path + " org.bluez.Device.SetProperty(Alias, kitchen-nas)" }));
    EXPECT_TRUE(log.lines().empty());
}

std::atomic<int> gCalls{ 0 };
RemoteObject* gGiven = nullptr;
void recordNoArgument(RemoteObject* object) {
    gGiven = object;
    ++gCalls;
}

TEST_F(ADevice, PrintsADisconnectRequestWithTheReceivingThreadsProxy) {
    RemoteObject* loop = sim::receivingLoop();
    gCalls = 0;
    std::unique_ptr<Device> phone(adapter->createDevice("5C:F3:70:61:A0:17"));  // link up for a while
    ASSERT_NE(phone, nullptr) << adapter->getErrorMessage();
    ASSERT_EQ(phone->setDisconnectRequestedHandler(nullptr), 0);
    ASSERT_EQ(phone->setDisconnectRequestedHandler(&recordNoArgument), 0);
    testing::internal::CaptureStdout();
    ASSERT_EQ(adapter->removeDevice(phone->getPath()), 0);
    bool arrived = waitUntil([] { return gCalls >= 1; });
    std::string out = testing::internal::GetCapturedStdout();
    ASSERT_TRUE(arrived);
    // Argument-less signals reach handlers with the dispatching object.
    EXPECT_EQ(gGiven, loop);
    EXPECT_EQ(out, std::string("Disconnect requested from ") + loop->getPath() + "\n");
}

class AnAudioDevice : public ADevice {
protected:
    void SetUp() override {
        ADevice::SetUp();
        device.reset(adapter->createDevice(kHeadset));
        ASSERT_NE(device, nullptr);
        path = device->getPath();
        sink.reset(AudioSink::getAudioSink(path.c_str()));
        control.reset(Control::getControl(path.c_str()));
        audio.reset(Audio::getAudio(path.c_str()));
        ASSERT_TRUE(sink && control && audio);
    }
    std::unique_ptr<Device> device;
    std::string path;
    std::unique_ptr<AudioSink> sink;
    std::unique_ptr<Control> control;
    std::unique_ptr<Audio> audio;
};

TEST_F(AnAudioDevice, ConnectsAllProfilesSendsVolumeKeysAndDisconnectsWithoutWaiting) {
    bool connected = true;
    ASSERT_EQ(control->isConnected(connected), 0);
    EXPECT_FALSE(connected);
    LogCapture log;
    EXPECT_EQ(audio->connect(), 0);
    EXPECT_EQ(audio->connect(), 0);  // refused: already connecting
    ASSERT_TRUE(waitUntil([&] { return sink->isConnected(connected) == 0 && connected; }));
    ASSERT_TRUE(waitUntil([&] { return control->isConnected(connected) == 0 && connected; }));
    std::unique_ptr<Dict> state(audio->getProperties());
    ASSERT_TRUE(state != nullptr);
    EXPECT_EQ(Bluetooth::find(state.get(), "State"), "connected");
    EXPECT_EQ(control->volumeUp(), 0);
    EXPECT_EQ(control->volumeDown(), 0);
    EXPECT_EQ(control->volumeUp(), 0);
    EXPECT_EQ(audio->disconnect(), 0);
    ASSERT_TRUE(sim::waitForLogLine("org.bluez.Audio.Disconnect"));
    EXPECT_EQ(sim::logLinesWith(" org.bluez.Audio."),
              (std::vector<std::string>{ path + " org.bluez.Audio.Connect()",
                                         path + " org.bluez.Audio.Connect()",
                                         path + " org.bluez.Audio.GetProperties()",
                                         path + " org.bluez.Audio.Disconnect()" }));
    EXPECT_EQ(sim::logLinesWith(" org.bluez.Control.Volume"),
              (std::vector<std::string>{ path + " org.bluez.Control.VolumeUp()",
                                         path + " org.bluez.Control.VolumeDown()",
                                         path + " org.bluez.Control.VolumeUp()" }));
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(AnAudioDevice, ReportsTheSinksStateAndPrintsItsSignals) {
    RemoteObject* loop = sim::receivingLoop();
    gCalls = 0;
    ASSERT_EQ(sink->setConnectedHandler(nullptr), 0);
    ASSERT_EQ(sink->setPlayingHandler(nullptr), 0);
    ASSERT_EQ(sink->setStoppedHandler(nullptr), 0);
    ASSERT_EQ(sink->setDisconnectedHandler(nullptr), 0);
    ASSERT_EQ(control->setConnectedHandler(nullptr), 0);
    ASSERT_EQ(sink->setDisconnectedHandler(&recordNoArgument), 0);
    bool connected = true;
    ASSERT_EQ(sink->isConnected(connected), 0);
    EXPECT_FALSE(connected);
    testing::internal::CaptureStdout();
    EXPECT_EQ(sink->connect(), 0);
    bool up = waitUntil([&] { return sink->isConnected(connected) == 0 && connected; });
    sim::setPlaying("hci0", kHeadset, true);
    sim::setPlaying("hci0", kHeadset, false);
    EXPECT_EQ(sink->disconnect(), 0);
    bool down = waitUntil([] { return gCalls >= 1; });
    std::string out = testing::internal::GetCapturedStdout();
    ASSERT_TRUE(up && down) << out;
    const std::string from = loop->getPath();
    EXPECT_NE(out.find("Connected from " + from + "\n"), std::string::npos) << out;
    EXPECT_NE(out.find("Playing in " + from + "\nStopped in " + from + "\n"), std::string::npos) << out;
    EXPECT_NE(out.find("Disconnected from " + from + "\n"), std::string::npos) << out;
    // The sink's and the control's "Connected" are told apart by interface: two lines.
    size_t first = out.find("Connected from ");
    EXPECT_NE(out.find("Connected from ", first + 1), std::string::npos) << out;
    ASSERT_EQ(sink->isConnected(connected), 0);
    EXPECT_FALSE(connected);
}

}  // namespace
