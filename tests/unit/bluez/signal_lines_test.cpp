// The default signal handlers' lines on standard output.
#include <functional>
#include <iostream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

namespace {

using namespace Bluetooth;

std::string printed(const std::function<void()>& print) {
    testing::internal::CaptureStdout();
    print();
    return testing::internal::GetCapturedStdout();
}

// The stream stays failed after a null piece: restore it for later tests.
struct RestoreCout {
    ~RestoreCout() { std::cout.clear(); }
};

TEST(TheDefaultHandlers, PrintTheirLineWithTheRegisteringProxysPath) {
    Manager manager;
    Adapter adapter("/org/bluez/77/hci0");
    Device device("/org/bluez/77/hci0/dev_00_11_22_33_44_55");
    AudioSink sink("/org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C3");
    Control control("/org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C4");
    const ObjectPath adapterPath("/org/bluez/77/hci1");
    const ObjectPath devicePath("/org/bluez/77/hci0/dev_00_11_22_33_44_55");
    struct Case {
        std::function<void()> print;
        std::string line;
    };
    const std::vector<Case> cases = {
        { [&] { Manager::adapterAddedHandler(&manager, &adapterPath); },
          "/org/bluez/77/hci1 was added by /\n" },
        { [&] { Manager::adapterRemovedHandler(&manager, &adapterPath); },
          "/org/bluez/77/hci1 was removed by /\n" },
        { [&] { Manager::defaultAdapterChangedHandler(&manager, &adapterPath); },
          "Default adpater is /org/bluez/77/hci1 in / now\n" },
        { [&] { Adapter::deviceDisappearedHandler(&adapter, "00:11:22:33:44:55"); },
          "00:11:22:33:44:55 was disappeared in /org/bluez/77/hci0\n" },
        { [&] { Adapter::deviceCreatedHandler(&adapter, &devicePath); },
          "/org/bluez/77/hci0/dev_00_11_22_33_44_55 was created by /org/bluez/77/hci0\n" },
        { [&] { Adapter::deviceRemovedHandler(&adapter, &devicePath); },
          "/org/bluez/77/hci0/dev_00_11_22_33_44_55 was removed by /org/bluez/77/hci0\n" },
        { [&] { Device::disconnectRequestedHandler(&device); },
          "Disconnect requested from /org/bluez/77/hci0/dev_00_11_22_33_44_55\n" },
        { [&] { AudioSink::connectedHandler(&sink); },
          "Connected from /org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C3\n" },
        { [&] { AudioSink::disconnectedHandler(&sink); },
          "Disconnected from /org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C3\n" },
        { [&] { AudioSink::playingHandler(&sink); },
          "Playing in /org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C3\n" },
        { [&] { AudioSink::stoppedHandler(&sink); },
          "Stopped in /org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C3\n" },
        { [&] { Control::connectedHandler(&control); },
          "Connected from /org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C4\n" },
        { [&] { Control::disconnectedHandler(&control); },
          "Disconnected from /org/bluez/77/hci0/dev_00_0D_3C_A1_B2_C4\n" },
    };
    for (const Case& c : cases) EXPECT_EQ(printed(c.print), c.line);
}

TEST(TheDefaultHandlers, PrintAPropertyChangeWithTheValuesTextForm) {
    Device device("/org/bluez/77/hci0/dev_00_11_22_33_44_55");
    struct Case {
        const char* name;
        Variant value;
        std::string text;
    };
    const std::vector<Case> cases = {
        { "Paired", Variant(true), "1" },
        { "Class", Variant(0x240404u), "2360324" },
        { "RSSI", Variant(-60), "-60" },
        { "Alias", Variant(std::string("BT Headset")), "BT Headset" },
        { "UUIDs", Variant(std::vector<std::string>{ "a", "b" }), "[a, b]" },
    };
    for (const Case& c : cases)
        EXPECT_EQ(printed([&] { BluezObject::propertyChangedHandler(&device, c.name, &c.value); }),
                  std::string(c.name) + " was changed in /org/bluez/77/hci0/dev_00_11_22_33_44_55 with " +
                      c.text + "\n");
}

TEST(TheDefaultHandlers, PrintAFoundDeviceOnTwoLinesTheSecondBeingItsProperties) {
    Adapter adapter("/org/bluez/77/hci0");
    Dict properties = { Entry("Address", Variant(std::string("00:11:22:33:44:55"))),
                        Entry("RSSI", Variant(-52)) };
    EXPECT_EQ(printed([&] { Adapter::deviceFoundHandler(&adapter, "00:11:22:33:44:55", &properties); }),
              "00:11:22:33:44:55 was found by /org/bluez/77/hci0\n"
              "Address: 00:11:22:33:44:55\nRSSI: -52\n\n");
    Dict none;
    EXPECT_EQ(printed([&] { Adapter::deviceFoundHandler(&adapter, "00:11:22:33:44:55", &none); }),
              "00:11:22:33:44:55 was found by /org/bluez/77/hci0\n\n");
}

TEST(TheDefaultHandlers, LoseTheRestOfTheLineAfterANullPieceWithoutCrashing) {
    RestoreCout restore;
    Adapter adapter("/org/bluez/77/hci0");
    Variant value(true);
    EXPECT_EQ(printed([&] { BluezObject::propertyChangedHandler(&adapter, nullptr, &value); }), "");
    EXPECT_TRUE(std::cout.fail());
    std::cout.clear();
    EXPECT_EQ(printed([&] { BluezObject::propertyChangedHandler(&adapter, "Powered", nullptr); }),
              "Powered was changed in /org/bluez/77/hci0 with ");
    std::cout.clear();
    EXPECT_EQ(printed([&] { Manager::adapterAddedHandler(nullptr, nullptr); }), "");
    std::cout.clear();
    EXPECT_EQ(printed([&] { Adapter::deviceFoundHandler(&adapter, "00:11:22:33:44:55", nullptr); }),
              "00:11:22:33:44:55 was found by /org/bluez/77/hci0\n");
    std::cout.clear();
    EXPECT_EQ(printed([&] { AudioSink::playingHandler(nullptr); }), "Playing in ");
}

}  // namespace
