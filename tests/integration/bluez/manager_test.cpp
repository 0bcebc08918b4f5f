// Manager and the factories against bluez4-sim.
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

const char kSecondAddress[] = "00:1A:7D:DA:71:14";

TEST(TheFactories, ReturnNullWhileNobodyOwnsOrgBluezAndProxiesOnceItIsBack) {
    sim::kill();
    LogCapture log;
    EXPECT_FALSE(BluezObject::hasBluetoothd());
    EXPECT_EQ(Manager::getManager(), nullptr);
    EXPECT_EQ(Adapter::getAdapter("/org/bluez/1/hci0"), nullptr);
    EXPECT_EQ(Device::getDevice("/org/bluez/1/hci0/dev_00_0D_3C_A1_B2_C3"), nullptr);
    EXPECT_EQ(Audio::getAudio("/org/bluez/1/hci0/dev_00_0D_3C_A1_B2_C3"), nullptr);
    EXPECT_EQ(AudioSink::getAudioSink("/org/bluez/1/hci0/dev_00_0D_3C_A1_B2_C3"), nullptr);
    EXPECT_EQ(Control::getControl("/org/bluez/1/hci0/dev_00_0D_3C_A1_B2_C3"), nullptr);
    EXPECT_TRUE(log.lines().empty()) << "asking the bus daemon succeeded: nothing to log";
    DBusObject bus;
    std::unique_ptr<std::vector<std::string> > names(bus.listNames());
    ASSERT_NE(names, nullptr);
    EXPECT_FALSE(names->empty()) << "the test's own connection is on the bus";

    ASSERT_TRUE(sim::start());
    EXPECT_TRUE(BluezObject::hasBluetoothd());
    std::unique_ptr<Manager> manager(Manager::getManager());
    ASSERT_NE(manager, nullptr);
    EXPECT_STREQ(manager->getPath(), "/");
    EXPECT_STREQ(manager->getInterface(), "org.bluez.Manager");
    EXPECT_STREQ(manager->getDestination(), "org.bluez");
    std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink("/any/path"));
    ASSERT_NE(sink, nullptr);
    EXPECT_STREQ(sink->getInterface(), "org.bluez.AudioSink");
}

class AManager : public SimTest {
protected:
    void SetUp() override {
        SimTest::SetUp();
        manager.reset(Manager::getManager());
        ASSERT_NE(manager, nullptr);
        defaultPath = sim::defaultAdapterPath();
        ASSERT_FALSE(defaultPath.empty());
    }
    std::unique_ptr<Manager> manager;
    std::string defaultPath;
};

TEST_F(AManager, FindsListsAndIndexesItsAdaptersGivingTheDefaultOnePastTheEnd) {
    std::unique_ptr<Adapter> byDefault(manager->defaultAdapter());
    ASSERT_NE(byDefault, nullptr);
    EXPECT_EQ(byDefault->getPath(), defaultPath);
    EXPECT_STREQ(byDefault->getInterface(), "org.bluez.Adapter");
    std::unique_ptr<Adapter> byName(manager->findAdapter("hci0"));
    ASSERT_NE(byName, nullptr);
    EXPECT_EQ(byName->getPath(), defaultPath);
    std::string second = sim::addAdapter("hci1", kSecondAddress);
    std::unique_ptr<Adapter> byAddress(manager->findAdapter(kSecondAddress));
    ASSERT_NE(byAddress, nullptr);
    EXPECT_EQ(byAddress->getPath(), second);
    std::unique_ptr<AdapterList> adapters(manager->listAdapters());
    ASSERT_NE(adapters, nullptr);
    ASSERT_EQ(adapters->size(), 2u);
    EXPECT_EQ((*adapters)[0]->getPath(), defaultPath);
    EXPECT_EQ((*adapters)[1]->getPath(), second);
    std::unique_ptr<Dict> properties(manager->getProperties());
    ASSERT_TRUE(properties != nullptr);
    EXPECT_EQ(Bluetooth::find(properties.get(), "Adapters"), "[" + defaultPath + ", " + second + "]");
    std::unique_ptr<Adapter> at1(manager->getAdapterByIndex(1));
    ASSERT_NE(at1, nullptr);
    EXPECT_EQ(at1->getPath(), second);
    sim::clearCallLog();
    std::unique_ptr<Adapter> past(manager->getAdapterByIndex(2));
    ASSERT_NE(past, nullptr);
    EXPECT_EQ(past->getPath(), defaultPath);
    EXPECT_EQ(sim::logLinesWith("org.bluez.Manager."),
              (std::vector<std::string>{ "/ org.bluez.Manager.ListAdapters()", "/ org.bluez.Manager.DefaultAdapter()" }));
    EXPECT_FALSE(manager->hasError());
}

TEST_F(AManager, LogsWhenBluezFindsNoAdapterAndListAdaptersNeitherResetsThatErrorNorLogs) {
    LogCapture log;
    EXPECT_EQ(manager->findAdapter("hci7"), nullptr);
    EXPECT_EQ(manager->getErrorNumber(), 11);
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "manager.cpp:156 No such adapter" });
    EXPECT_EQ(sim::logLinesWith("org.bluez.Manager.FindAdapter(hci7)").size(), 1u);
    log.clear();
    std::unique_ptr<AdapterList> adapters(manager->listAdapters());
    ASSERT_NE(adapters, nullptr);
    EXPECT_EQ(adapters->size(), 1u);
    EXPECT_EQ(manager->getErrorNumber(), 11) << "the error of findAdapter was cleared";
    EXPECT_TRUE(log.lines().empty());
}

TEST_F(AManager, WithoutAdaptersListsNoneAndFallsBackToADefaultThatDoesNotExist) {
    sim::removeAdapter("hci0");
    std::unique_ptr<AdapterList> adapters(manager->listAdapters());
    ASSERT_NE(adapters, nullptr);
    EXPECT_TRUE(adapters->empty());
    LogCapture log;
    EXPECT_EQ(manager->getAdapterByIndex(0), nullptr);
    EXPECT_EQ(log.lines(), std::vector<std::string>{ "manager.cpp:96 No such adapter" });
    EXPECT_EQ(manager->defaultAdapter(), nullptr);
}

// Handlers that record what they were given, for the signal tests: written on
// the receiving thread, read here.
std::mutex gLock;
std::vector<std::string> gPaths;
RemoteObject* gReceiver = nullptr;
void recordPath(RemoteObject* object, const ObjectPath* path) {
    std::lock_guard<std::mutex> hold(gLock);
    gReceiver = object;
    gPaths.push_back(path->str());
}

TEST_F(AManager, ReportsAdaptersComingAndGoingToItsHandlers) {
    sim::receivingLoop();
    {
        std::lock_guard<std::mutex> hold(gLock);
        gPaths.clear();
    }
    ASSERT_EQ(manager->setAdapterAddedHandler(nullptr), 0);
    ASSERT_EQ(manager->setDefaultAdapterChangedHandler(nullptr), 0);
    ASSERT_EQ(manager->setAdapterRemovedHandler(nullptr), 0);
    ASSERT_EQ(manager->setAdapterAddedHandler(&recordPath), 0);
    ASSERT_EQ(manager->setDefaultAdapterChangedHandler(&recordPath), 0);
    ASSERT_EQ(manager->setAdapterRemovedHandler(&recordPath), 0);
    testing::internal::CaptureStdout();
    sim::removeAdapter("hci0");  // default gone, no other adapter: no DefaultAdapterChanged
    std::string second = sim::addAdapter("hci1", kSecondAddress);
    bool arrived = waitUntil([] {
        std::lock_guard<std::mutex> hold(gLock);
        return gPaths.size() >= 3;
    });
    std::string out = testing::internal::GetCapturedStdout();
    ASSERT_TRUE(arrived);
    std::lock_guard<std::mutex> hold(gLock);
    EXPECT_EQ(gPaths, (std::vector<std::string>{ defaultPath, second, second }));
    EXPECT_EQ(gReceiver, manager.get());
    EXPECT_EQ(out, defaultPath + " was removed by /\n" + second + " was added by /\n" +
                       "Default adpater is " + second + " in / now\n");
}

}  // namespace
