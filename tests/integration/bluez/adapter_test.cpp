// Adapter against bluez4-sim: one-way requests through the call log, queries,
// device creation and the adapter's signals.
#include <algorithm>
#include <atomic>
#include <map>
#include <memory>
#include <mutex>
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
using btbus_test::sim::kKeyboard;
using btbus_test::sim::kPhone;
using btbus_test::sim::kFarLaptop;
using btbus_test::sim::kMouse;

class AnAdapter : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        path = sim::defaultAdapterPath();
        adapter.reset(Adapter::getAdapter(path.c_str()));
        ASSERT_NE(adapter, nullptr);
    }
    std::string path;
    std::unique_ptr<Adapter> adapter;
};

TEST_F(AnAdapter, SendsItsOneWayRequestsInOrderWithoutWaitingForBluez) {
    Agent agent;
    ASSERT_EQ(agent.registerPath(), 0);
    std::string mouse = sim::devicePath(kMouse);
    LogCapture log;
    EXPECT_EQ(adapter->registerAgent(agent), 0);
    EXPECT_EQ(adapter->requestSession(), 0);
    EXPECT_EQ(adapter->startDiscovery(), 0);
    EXPECT_EQ(adapter->stopDiscovery(), 0);
    EXPECT_EQ(adapter->releaseSession(), 0);
    EXPECT_EQ(adapter->setProperty("Name", Variant(std::string("btbus test"))), 0);
    EXPECT_EQ(adapter->cancelDeviceCreation(kKeyboard), 0);  // nothing in progress: refused
    EXPECT_EQ(adapter->removeDevice(mouse.c_str()), 0);
    EXPECT_EQ(adapter->setProperty("Powered", Variant(false)), 0);
    EXPECT_EQ(adapter->startDiscovery(), 0);  // refused: the adapter is off
    EXPECT_EQ(adapter->setProperty("Class", Variant(7u)), 0);  // refused: read-only
    EXPECT_EQ(adapter->unregisterAgent(agent), 0);
    const std::string a = path + " org.bluez.Adapter.";
    const std::string agentPath = agent.getPath();
    const std::vector<std::string> expected = {
        a + "RegisterAgent(" + agentPath + ", DisplayYesNo)",
        a + "RequestSession()",
        a + "StartDiscovery()",
        a + "StopDiscovery()",
        a + "ReleaseSession()",
        a + "SetProperty(Name, btbus test)",
        a + "CancelDeviceCreation(" + kKeyboard + ")",
        a + "RemoveDevice(" + mouse + ")",
        a + "SetProperty(Powered, false)",
        a + "StartDiscovery()",
        a + "SetProperty(Class, 7)",
        a + "UnregisterAgent(" + agentPath + ")",
    };
    ASSERT_TRUE(sim::waitForLogLine("UnregisterAgent"));
    EXPECT_EQ(sim::logLinesWith(" org.bluez.Adapter."), expected);
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(agent.unregisterPath(), 0);
}

TEST_F(AnAdapter, FindsKnownDevicesAndLogsAnUnknownAddressOnlyWhenAsked) {
    std::unique_ptr<Device> mouse(adapter->findDevice(kMouse, true));
    ASSERT_NE(mouse, nullptr);
    EXPECT_EQ(mouse->getPath(), sim::devicePath(kMouse));
    EXPECT_STREQ(mouse->getInterface(), "org.bluez.Device");
    LogCapture log;
    EXPECT_EQ(adapter->findDevice(kPhone, false), nullptr);
    EXPECT_EQ(adapter->getErrorNumber(), 11);
    EXPECT_TRUE(log.lines().empty());
    EXPECT_EQ(adapter->findDevice(kPhone, true), nullptr);
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "adapter.cpp:180 Does Not Exist" });
}

TEST_F(AnAdapter, CreatesADeviceOnceAndLogsWhyItCannotOtherwise) {
    std::unique_ptr<Device> phone(adapter->createDevice(kPhone));
    ASSERT_NE(phone, nullptr);
    EXPECT_EQ(phone->getPath(), sim::devicePath(kPhone));
    LogCapture log;
    EXPECT_EQ(adapter->createDevice(kPhone), nullptr);
    EXPECT_EQ(adapter->getErrorName(), "org.bluez.Error.AlreadyExists");
    EXPECT_EQ(adapter->createDevice(kFarLaptop), nullptr);
    EXPECT_EQ(adapter->createDevice("not an address"), nullptr);
    EXPECT_EQ(log.lines(), (std::vector<std::string>{ "adapter.cpp:274 Already Exists",
                                                      "adapter.cpp:274 Host is down",
                                                      "adapter.cpp:274 Invalid arguments in method call" }));
}

TEST_F(AnAdapter, ListsItsDevicesAndGivesNullWithoutErrorPastTheEndOrWhenItHasNone) {
    std::unique_ptr<Device> phone(adapter->createDevice(kPhone));
    ASSERT_NE(phone, nullptr);
    std::unique_ptr<DeviceList> devices(adapter->listDevices());
    ASSERT_NE(devices, nullptr);
    ASSERT_EQ(devices->size(), 2u);
    std::vector<std::string> paths;
    for (size_t i = 0; i < devices->size(); ++i) {
        paths.push_back((*devices)[i]->getPath());
        std::unique_ptr<Device> at(adapter->getDeviceByIndex(i));
        ASSERT_NE(at, nullptr);
        EXPECT_EQ(at->getPath(), paths.back());
    }
    EXPECT_NE(std::find(paths.begin(), paths.end(), sim::devicePath(kPhone)), paths.end());
    EXPECT_NE(std::find(paths.begin(), paths.end(), sim::devicePath(kMouse)), paths.end());
    LogCapture log;
    EXPECT_EQ(adapter->getDeviceByIndex(2), nullptr);
    EXPECT_FALSE(adapter->hasError());
    EXPECT_TRUE(log.lines().empty());
    ASSERT_TRUE(sim::start());  // the mouse alone again: the phone's link keeps it a while
    ASSERT_EQ(adapter->removeDevice(sim::devicePath(kMouse).c_str()), 0);
    ASSERT_TRUE(sim::waitForLogLine("RemoveDevice"));
    devices.reset(adapter->listDevices());
    ASSERT_NE(devices, nullptr);
    EXPECT_TRUE(devices->empty());
    EXPECT_EQ(adapter->getDeviceByIndex(0), nullptr);
}

std::atomic<int> gSignals{ 0 };
void countAddress(RemoteObject*, const char*) { ++gSignals; }
void countPath(RemoteObject*, const ObjectPath*) { ++gSignals; }
void countChange(RemoteObject*, const char*, const Variant*) { ++gSignals; }

TEST_F(AnAdapter, PrintsCreatedRemovedAndChangedThroughItsDefaultHandlers) {
    sim::receivingLoop();
    gSignals = 0;
    ASSERT_EQ(adapter->setDeviceCreatedHandler(nullptr), 0);
    ASSERT_EQ(adapter->setDeviceRemovedHandler(nullptr), 0);
    ASSERT_EQ(adapter->setPropertyChangedHandler(nullptr), 0);
    ASSERT_EQ(adapter->setDeviceCreatedHandler(&countPath), 0);
    ASSERT_EQ(adapter->setDeviceRemovedHandler(&countPath), 0);
    ASSERT_EQ(adapter->setPropertyChangedHandler(&countChange), 0);
    std::string mouse = sim::devicePath(kMouse);
    testing::internal::CaptureStdout();
    std::unique_ptr<Device> phone(adapter->createDevice(kPhone));
    adapter->removeDevice(mouse.c_str());
    adapter->setProperty("Name", Variant(std::string("renamed")));
    // DeviceCreated, Devices, DeviceRemoved, Devices, Name
    bool arrived = waitUntil([] { return gSignals >= 5; });
    std::string out = testing::internal::GetCapturedStdout();
    ASSERT_TRUE(arrived) << out;
    ASSERT_NE(phone, nullptr);
    EXPECT_NE(out.find(sim::devicePath(kPhone) + " was created by " + path + "\n"), std::string::npos) << out;
    EXPECT_NE(out.find(mouse + " was removed by " + path + "\n"), std::string::npos) << out;
    EXPECT_NE(out.find("Name was changed in " + path + " with renamed\n"), std::string::npos) << out;
}

// Written on the receiving thread, read here.
std::mutex gLock;
std::map<std::string, Dict> gFound;
void recordFound(RemoteObject*, const char* address, const Dict* properties) {
    std::lock_guard<std::mutex> hold(gLock);
    gFound.emplace(address, *properties);
}

TEST_F(AnAdapter, ReportsFoundAndDisappearedDevicesDuringDiscoveryToItsHandlers) {
    sim::receivingLoop();
    gSignals = 0;
    {
        std::lock_guard<std::mutex> hold(gLock);
        gFound.clear();
    }
    ASSERT_EQ(adapter->setDeviceFoundHandler(nullptr), 0);
    ASSERT_EQ(adapter->setDeviceFoundHandler(&recordFound), 0);
    ASSERT_EQ(adapter->setDeviceDisappearedHandler(nullptr), 0);
    ASSERT_EQ(adapter->setDeviceDisappearedHandler(&countAddress), 0);
    testing::internal::CaptureStdout();
    ASSERT_EQ(adapter->startDiscovery(), 0);
    ASSERT_TRUE(sim::waitForLogLine("StartDiscovery"));
    sim::setInRange("hci0", kPhone, false);
    bool disappeared = waitUntil([] { return gSignals >= 1; });
    adapter->stopDiscovery();
    sim::setInRange("hci0", kPhone, true);  // the simulator's Reset keeps the range
    std::string out = testing::internal::GetCapturedStdout();
    ASSERT_TRUE(disappeared) << out;
    EXPECT_NE(out.find(std::string(kKeyboard) + " was found by " + path + "\nAddress: " + kKeyboard + "\n"),
              std::string::npos) << out;
    EXPECT_NE(out.find(std::string(kPhone) + " was disappeared in " + path + "\n"), std::string::npos) << out;
    EXPECT_EQ(out.find(std::string(kFarLaptop) + " was found"), std::string::npos) << out;
    std::lock_guard<std::mutex> hold(gLock);
    ASSERT_EQ(gFound.count(kKeyboard), 1u);
    const Dict& keyboard = gFound[kKeyboard];
    EXPECT_EQ(Bluetooth::find(&keyboard, "Address"), kKeyboard);
    EXPECT_EQ(Bluetooth::find(&keyboard, "LegacyPairing"), "1");
    EXPECT_EQ(Bluetooth::find(&keyboard, "RSSI"), "-61");
}

}  // namespace
