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
    const std::string a = "/org/bluez/77/hci0", d = a + "/dev_00_11_22_33_44_55", s = a + "/dev_00_0D_3C_A1_B2_C3",
                      c = a + "/dev_00_0D_3C_A1_B2_C4", address = "00:11:22:33:44:55";
    Manager manager;
    Adapter adapter(a.c_str());
    Device device(d.c_str());
    AudioSink sink(s.c_str());
    Control control(c.c_str());
    const ObjectPath adapterPath("/org/bluez/77/hci1");
    const ObjectPath devicePath(d);
    Dict properties = { Entry("Address", Variant(address)), Entry("RSSI", Variant(-52)) }, none;
    struct Case {
        std::function<void()> print;
        std::string line;
    };
    const std::vector<Case> cases = {
        { [&] { Manager::adapterAddedHandler(&manager, &adapterPath); }, "/org/bluez/77/hci1 was added by /\n" },
        { [&] { Manager::adapterRemovedHandler(&manager, &adapterPath); }, "/org/bluez/77/hci1 was removed by /\n" },
        { [&] { Manager::defaultAdapterChangedHandler(&manager, &adapterPath); },
          "Default adpater is /org/bluez/77/hci1 in / now\n" },
        { [&] { Adapter::deviceDisappearedHandler(&adapter, address.c_str()); },
          address + " was disappeared in " + a + "\n" },
        { [&] { Adapter::deviceCreatedHandler(&adapter, &devicePath); }, d + " was created by " + a + "\n" },
        { [&] { Adapter::deviceRemovedHandler(&adapter, &devicePath); }, d + " was removed by " + a + "\n" },
        // A found device on two lines, the second being its properties.
        { [&] { Adapter::deviceFoundHandler(&adapter, address.c_str(), &properties); },
          address + " was found by " + a + "\nAddress: " + address + "\nRSSI: -52\n\n" },
        { [&] { Adapter::deviceFoundHandler(&adapter, address.c_str(), &none); },
          address + " was found by " + a + "\n\n" },
        { [&] { Device::disconnectRequestedHandler(&device); }, "Disconnect requested from " + d + "\n" },
        { [&] { AudioSink::connectedHandler(&sink); }, "Connected from " + s + "\n" },
        { [&] { AudioSink::disconnectedHandler(&sink); }, "Disconnected from " + s + "\n" },
        { [&] { AudioSink::playingHandler(&sink); }, "Playing in " + s + "\n" },
        { [&] { AudioSink::stoppedHandler(&sink); }, "Stopped in " + s + "\n" },
        { [&] { Control::connectedHandler(&control); }, "Connected from " + c + "\n" },
        { [&] { Control::disconnectedHandler(&control); }, "Disconnected from " + c + "\n" },
    };
    for (const Case& row : cases) EXPECT_EQ(printed(row.print), row.line);
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
