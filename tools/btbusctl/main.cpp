// btbusctl: the btbus library from a shell.
#include <iostream>

#include <CLI/CLI.hpp>

#include "commands.h"

using namespace btbusctl;

namespace {

const char kCapabilities[] = "DisplayOnly, DisplayYesNo, KeyboardOnly, NoInputNoOutput, KeyboardDisplay";

void agentOptions(CLI::App* command, AgentOptions& agent) {
    CLI::Option* pin = command->add_option("--pin", agent.pin, "PIN code to answer (legacy pairing)");
    command->add_option("--passkey", agent.pin, "passkey to answer (0 to 999999)")
        ->check(CLI::Range(0, 999999))
        ->excludes(pin);
    command->add_option("--capability", agent.capability, std::string("the agent's IO capability: ") + kCapabilities)
        ->check(CLI::IsMember({"DisplayOnly", "DisplayYesNo", "KeyboardOnly", "NoInputNoOutput",
                               "KeyboardDisplay"}));
    command->add_flag("--reject", agent.reject, "refuse passkey, confirmation and authorization requests");
    command->add_option("--delay", agent.delay, "seconds to wait before answering")
        ->check(CLI::NonNegativeNumber);
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app("Drive the BlueZ 4 Bluetooth daemon through the btbus library.", "btbusctl");
    app.set_version_flag("--version", "btbusctl " BTBUSCTL_VERSION);
    app.require_subcommand(1);
    app.fallthrough();
    Options options;
    app.add_option("-a,--adapter", options.adapter, "adapter name or address (default: BlueZ's default adapter)");
    app.add_flag("--json", options.json, "JSON on stdout: one document, or one object per line for streams");

    std::function<int()> run;
    std::string adapterName, property, value, address, pattern, action;
    int seconds = 10;
    AgentOptions agent;

    app.add_subcommand("adapters", "list the adapters, the default one marked")
        ->callback([&] { run = [&] { return listAdapters(options); }; });
    CLI::App* show = app.add_subcommand("show", "every property of an adapter, HCIVersion included");
    show->add_option("adapter", adapterName, "adapter name or address (default: -a, else the default one)");
    show->callback([&] {
        run = [&] {
            Options chosen = options;
            if (!adapterName.empty()) chosen.adapter = adapterName;
            return showAdapter(chosen);
        };
    });
    CLI::App* set = app.add_subcommand("set", "set an adapter property, then read it back");
    set->add_option("adapter", adapterName, "adapter name or address")->required();
    set->add_option("property", property,
                    "Name, Powered, Discoverable, Pairable, DiscoverableTimeout or PairableTimeout")
        ->required();
    set->add_option("value", value, "true/false, seconds, or text, as the property takes")->required();
    set->callback([&] { run = [&] { return setProperty(options, adapterName, property, value); }; });
    CLI::App* scanning = app.add_subcommand("scan", "report devices as they are found or disappear");
    scanning->add_option("--timeout", seconds, "seconds to scan, 0 until Ctrl-C")
        ->check(CLI::NonNegativeNumber)
        ->capture_default_str();
    bool shared = false;
    scanning->add_flag("--shared", shared,
                       "read through the scanner service on the session bus (started when not running)");
    scanning->callback([&] { run = [&] { return shared ? sharedScan(options, seconds) : scan(options, seconds); }; });

    app.add_subcommand("devices", "the devices the adapter knows")
        ->callback([&] { run = [&] { return listDevices(options); }; });
    CLI::App* info = app.add_subcommand("info", "every property of a known device");
    info->add_option("address", address, "device address")->required();
    info->callback([&] { run = [&] { return deviceInfo(options, address); }; });
    CLI::App* create = app.add_subcommand("create", "create the device object, without pairing");
    create->add_option("address", address, "device address")->required();
    create->callback([&] { run = [&] { return createDevice(options, address); }; });
    CLI::App* services = app.add_subcommand("services", "the service records of a known device");
    services->add_option("address", address, "device address")->required();
    services->add_option("pattern", pattern, "UUID or profile name to look for (default: all)");
    services->callback([&] { run = [&] { return btbusctl::services(options, address, pattern); }; });
    CLI::App* remove = app.add_subcommand("remove", "remove a device and its pairing");
    remove->add_option("address", address, "device address")->required();
    remove->callback([&] { run = [&] { return removeDevice(options, address); }; });

    CLI::App* pairing = app.add_subcommand("pair", "pair with a device, the library's agent answering");
    pairing->add_option("address", address, "device address")->required();
    agentOptions(pairing, agent);
    pairing->callback([&] { run = [&] { return pair(options, address, agent); }; });
    CLI::App* standing = app.add_subcommand("agent", "answer bluetoothd's requests until interrupted");
    agentOptions(standing, agent);
    standing->callback([&] { run = [&] { return standingAgent(options, agent); }; });

    CLI::App* sound = app.add_subcommand("audio", "connect, disconnect or show a device's audio");
    sound->add_option("action", action, "connect, disconnect or status")
        ->required()
        ->check(CLI::IsMember({"connect", "disconnect", "status"}));
    sound->add_option("address", address, "device address")->required();
    sound->callback([&] { run = [&] { return audio(options, action, address); }; });
    CLI::App* loudness = app.add_subcommand("volume", "send a volume key to a device's remote control");
    loudness->add_option("direction", action, "up or down")->required()->check(CLI::IsMember({"up", "down"}));
    loudness->add_option("address", address, "device address")->required();
    loudness->callback([&] { run = [&] { return volume(options, action, address); }; });
    app.add_subcommand("watch", "report property changes, devices and audio events until Ctrl-C")
        ->callback([&] { run = [&] { return watch(options); }; });

    CLI::App* autoconnect = app.add_subcommand("autoconnect", "the adapter's auto-connect list and its daemon");
    autoconnect->add_option("action", action, "show, enable, disable, add, remove, reload, pause or resume")
        ->required()
        ->check(CLI::IsMember({"show", "enable", "disable", "add", "remove", "reload", "pause", "resume"}));
    autoconnect->add_option("address", address, "device address, for add and remove");
    autoconnect->callback([&] { run = [&] { return autoConnect(options, action, address); }; });
    CLI::App* naming = app.add_subcommand("name", "read a device's name over HCI");
    naming->add_option("address", address, "device address")->required();
    std::string wait = "default";
    naming->add_option("--wait", wait, "how long to wait for the answer: short, default or long")
        ->check(CLI::IsMember({"short", "default", "long"}))
        ->capture_default_str();
    naming->callback([&] { run = [&] { return remoteName(options, address, wait); }; });
    app.add_subcommand("restart-daemon", "restart bluetoothd when an adapter is attached (as root)")
        ->callback([&] { run = [&] { return restartDaemon(options); }; });

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        std::vector<std::string> rest = app.remaining();
        if (app.get_subcommands().empty() && !rest.empty()) {
            std::cerr << "btbusctl: unknown command " << rest.front() << "\nRun with --help for more information."
                      << std::endl;
            return kUsage;
        }
        return app.exit(e) == 0 ? kOk : kUsage;
    }
    try {
        return run();
    } catch (const UsageError& e) {
        std::cerr << "btbusctl: " << e.what() << std::endl;
        return kUsage;
    } catch (const std::exception& e) {
        std::cerr << "btbusctl: " << e.what() << std::endl;
        return kFailed;
    }
}
