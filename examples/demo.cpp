// What an appliance daemon does with btbus, from the manager down: find the
// adapter, watch discovery, pair a keyboard through the library's own agent,
// list the devices, and connect a headset's audio.
#include <unistd.h>

#include <iostream>
#include <memory>

#include <bluetooth/btbus.h>

using namespace Bluetooth;

namespace {

const char kKeyboard[] = "00:12:A1:B0:00:42";  // a legacy device that asks for PIN 0000
const char kHeadset[] = "00:0D:3C:A1:B2:C3";   // A2DP sink and remote control

void section(const char* title) { std::cout << "\n== " << title << std::endl; }

}  // namespace

int main() {
    std::unique_ptr<Manager> manager(Manager::getManager());
    if (!manager) {
        std::cerr << "bluetoothd is not on the system bus" << std::endl;
        return 1;
    }
    std::unique_ptr<Adapter> adapter(manager->defaultAdapter());
    if (!adapter) {
        std::cerr << "no default adapter: " << manager->getErrorMessage() << std::endl;
        return 1;
    }

    section("Default adapter");
    std::cout << adapter->getPath() << std::endl;
    std::unique_ptr<Dict> properties(adapter->getProperties());
    if (properties) std::cout << dictToString(*properties);

    // The library's default handlers print each signal on a line of its own.
    adapter->setDeviceFoundHandler(0);
    adapter->setDeviceCreatedHandler(0);
    adapter->setPropertyChangedHandler(0);
    manager->startLoop();

    section("Discovery");
    adapter->startDiscovery();
    usleep(1500000);
    adapter->stopDiscovery();
    usleep(200000);

    section("Pairing the keyboard (the agent answers PIN 0000)");
    Agent agent;
    agent.setPasskeyValue("0000");
    agent.registerPath();
    std::unique_ptr<Device> keyboard(adapter->createPairedDevice(kKeyboard, agent));
    if (keyboard)
        std::cout << "paired: " << keyboard->getPath() << std::endl;
    else
        std::cout << "pairing failed: " << adapter->getErrorMessage() << std::endl;

    section("Devices known to the adapter");
    std::unique_ptr<DeviceList> devices(adapter->listDevices());
    for (size_t i = 0; devices && i < devices->size(); ++i) {
        Device* device = (*devices)[i];
        if (device == 0) continue;
        std::unique_ptr<Dict> about(device->getProperties());
        std::cout << device->getPath() << "  " << find(about.get(), "Name") << "  paired "
                  << find(about.get(), "Paired") << std::endl;
    }

    section("Headset audio");
    std::unique_ptr<Device> headset(adapter->createDevice(kHeadset));
    if (!headset) headset.reset(adapter->findDevice(kHeadset, true));
    if (headset) {
        std::unique_ptr<AudioSink> sink(AudioSink::getAudioSink(headset->getPath()));
        std::unique_ptr<Control> control(Control::getControl(headset->getPath()));
        sink->setConnectedHandler(0);
        sink->connect();
        bool connected = false;
        for (int i = 0; i < 20 && !connected; ++i) {
            usleep(100000);
            sink->isConnected(connected);
        }
        std::cout << "audio sink connected: " << (connected ? "yes" : "no") << std::endl;
        if (control->volumeUp() == 0) std::cout << "volume up sent" << std::endl;
        sink->disconnect();
        usleep(200000);
    }

    manager->stopLoop();
    manager->waitLoop();
    agent.unregisterPath();
    return 0;
}
