// The default signal handlers' lines on standard output, called directly; most
// are also checked as the receiving thread prints them.
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
    std::cout.clear();  // a null piece leaves the stream failed
    return testing::internal::GetCapturedStdout();
}

TEST(TheDefaultHandlers, PrintTheirLineWithTheRegisteringProxysPathAndLoseTheRestAfterANullPiece) {
    const std::string a = "/org/bluez/77/hci0", c = a + "/dev_00_0D_3C_A1_B2_C4", address = "00:11:22:33:44:55";
    Adapter adapter(a.c_str());
    Control control(c.c_str());
    Dict properties = { Entry("Address", Variant(address)), Entry("RSSI", Variant(-52)) };
    const Variant uuids(std::vector<std::string>{ "a", "b" });
    const struct {
        std::function<void()> print;
        std::string line;
    } cases[] = {
        // A found device on two lines, the second being its properties.
        { [&] { Adapter::deviceFoundHandler(&adapter, address.c_str(), &properties); },
          address + " was found by " + a + "\nAddress: " + address + "\nRSSI: -52\n\n" },
        { [&] { Control::disconnectedHandler(&control); }, "Disconnected from " + c + "\n" },
        { [&] { BluezObject::propertyChangedHandler(&adapter, "UUIDs", &uuids); },
          "UUIDs was changed in " + a + " with [a, b]\n" },
        { [&] { BluezObject::propertyChangedHandler(&adapter, nullptr, &uuids); }, "" },
        { [&] { BluezObject::propertyChangedHandler(&adapter, "Powered", nullptr); },
          "Powered was changed in " + a + " with " },
        { [&] { Manager::adapterAddedHandler(nullptr, nullptr); }, "" },
        { [&] { Adapter::deviceFoundHandler(&adapter, address.c_str(), nullptr); },
          address + " was found by " + a + "\n" },
        { [&] { AudioSink::playingHandler(nullptr); }, "Playing in " },
    };
    for (const auto& row : cases) EXPECT_EQ(printed(row.print), row.line);
}

}  // namespace
