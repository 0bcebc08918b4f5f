// pair and agent: the library's Agent answers bluetoothd; a dispatcher in
// front of it reports each request it answers.
#include <cstdlib>

#include "commands.h"

using namespace Bluetooth;

namespace btbusctl {

namespace {

// Where the requests go: printed as they come (agent) or kept for the one
// document printed at the end (pair with --json). Touched by the thread that
// dispatches the system bus only while the agent is registered.
struct RequestLog {
    Output* out = 0;
    bool keep = false;
    json kept = json::array();
};
RequestLog gRequests;

std::string firstPathArgument(DBusMessage* message) {
    DBusMessageIter arguments;
    if (!dbus_message_iter_init(message, &arguments) ||
        dbus_message_iter_get_arg_type(&arguments) != DBUS_TYPE_OBJECT_PATH)
        return "";
    const char* path = 0;
    dbus_message_iter_get_basic(&arguments, &path);
    return path;
}

// What the library's Agent answers to member, from its settings.
std::string answerOf(const Agent& agent, const std::string& member) {
    if (member == "RequestPinCode") return agent.getPasskeyValue();
    if (member == "Cancel") return "canceled";
    if (member == "Release") return "released";
    bool known = member == "RequestPasskey" || member == "RequestConfirmation" || member == "Authorize";
    if (!known) return "not answered";
    if (agent.getReject()) return "rejected";
    if (member == "RequestPasskey")
        return std::to_string(std::strtoul(agent.getPasskeyValue(), 0, 10));
    return member == "Authorize" ? "authorized" : "confirmed";
}

DBusHandlerResult reportingDispatcher(DBusConnection* connection, DBusMessage* message, void* data) {
    const Agent* agent = static_cast<const Agent*>(data);
    const char* member = dbus_message_get_member(message);
    json request = {{"event", "request"},
                    {"request", member ? member : ""},
                    {"device", shortName(firstPathArgument(message))},
                    {"answer", answerOf(*agent, member ? member : "")}};
    DBusHandlerResult result = Agent::handlerDispatcher(connection, message, data);
    if (gRequests.keep) {
        gRequests.kept.push_back(request);
    } else if (gRequests.out->jsonMode()) {
        gRequests.out->print(request);
    } else {
        std::string line = "agent: " + request["request"].get<std::string>();
        if (!request["device"].get<std::string>().empty())
            line += " for " + request["device"].get<std::string>();
        gRequests.out->print(line + " -> " + request["answer"].get<std::string>());
    }
    return result;
}

// The library's Agent set up as the options say and registered on the bus.
class ServedAgent {
public:
    explicit ServedAgent(const AgentOptions& options) {
        if (!options.pin.empty()) agent_.setPasskeyValue(options.pin.c_str());
        agent_.setPasskeyDelay(options.delay);
        agent_.setReject(options.reject);
        agent_.setCapability(options.capability.c_str());  // kept alive by the options
        agent_.setDispatcher(&reportingDispatcher);
        if (agent_.registerPath() != 0)
            throw Failure("cannot serve the agent at /org/bluez/agent_<pid> on the system bus");
    }
    ~ServedAgent() { agent_.unregisterPath(); }
    Agent& operator*() { return agent_; }
    Agent* operator->() { return &agent_; }

private:
    Agent agent_;
};

}  // namespace

int pair(const Options& options, const std::string& address, const AgentOptions& settings) {
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    Output out(options);
    gRequests.out = &out;
    gRequests.keep = options.json;
    std::unique_ptr<Device> device;
    {
        ServedAgent agent(settings);
        out.progress("pairing with " + address + " (Ctrl-C cancels)");
        // Dispatches the system bus on this thread until bluetoothd answers,
        // so that the agent answers meanwhile.
        device.reset(chosen->createPairedDevice(address.c_str(), *agent));
        out.progress("");
    }
    if (!device) {
        if (chosen->getErrorNumber() == 2) {  // no reply: the wait was interrupted
            chosen->cancelDeviceCreation(address.c_str());
            // The cancel is sent without waiting, and may come too late: look.
            std::unique_ptr<Device> late(chosen->findDevice(address.c_str(), false));
            Dict props;
            if (late) props = properties(*late);
            const Variant* paired = lookup(props, "Paired");
            throw Failure("pairing with " + address + " interrupted" +
                          (paired && variantToBool(*paired) ? ", but it had completed: the device is paired" : ""));
        }
        throw failed("pairing with " + address, *chosen);
    }
    if (options.json)
        out.print(json{{"address", address}, {"path", device->getPath()}, {"paired", true},
                       {"requests", gRequests.kept}});
    else
        out.print("paired " + address + " (" + device->getPath() + ")");
    return kOk;
}

int standingAgent(const Options& options, const AgentOptions& settings) {
    blockStopSignals();  // before the receiving thread starts, so that it inherits the mask
    std::unique_ptr<Manager> bluez = manager();
    std::unique_ptr<Adapter> chosen = adapter(*bluez, options);
    Output out(options);
    gRequests.out = &out;
    ServedAgent agent(settings);
    watchRestarts(*bluez);
    bluez->startLoop();  // its thread dispatches the bus, so it serves the agent
    if (chosen->registerAgent(*agent) != 0) throw failed("RegisterAgent", *chosen);
    properties(*chosen);  // RegisterAgent was sent without waiting: now it has arrived
    std::string adapterName = shortName(chosen->getPath());
    if (options.json)
        out.print(json{{"event", "registered"}, {"path", agent->getPath()}, {"adapter", adapterName},
                       {"capability", settings.capability}});
    else
        out.print("agent " + std::string(agent->getPath()) + " (" + settings.capability +
                  ") offered to " + adapterName + "; answering until interrupted");
    while (!waitForStop(std::chrono::milliseconds(100))) {
        if (!restarted()) continue;
        // The new daemon knows nothing of the agent: offer it again.
        std::unique_ptr<Adapter> again = adapterAfterRestart(*bluez, options);
        if (!again || again->registerAgent(*agent) != 0) continue;
        chosen = std::move(again);
        properties(*chosen);
        reportRestart(out, *chosen, "agent offered to " + shortName(chosen->getPath()) + " again");
    }
    chosen->unregisterAgent(*agent);
    settle(*chosen);
    bluez->stopLoop();
    bluez->waitLoop();
    if (!options.json) out.print("agent unregistered");
    return kOk;
}

}  // namespace btbusctl
