// The commands of btbusctl; each returns the exit status or throws Failure or
// UsageError.
#ifndef BTBUSCTL_COMMANDS_H
#define BTBUSCTL_COMMANDS_H

#include <string>

#include "tool.h"

namespace btbusctl {

// The answers of the pairing agent, as pair and agent take them.
struct AgentOptions {
    std::string pin;           // PIN or passkey text the agent answers
    std::string capability = "DisplayYesNo";
    bool reject = false;
    int delay = 0;
};

int listAdapters(const Options& options);
int showAdapter(const Options& options);
int setProperty(const Options& options, const std::string& adapter, const std::string& property,
                const std::string& value);
int scan(const Options& options, int seconds);

int listDevices(const Options& options);
int deviceInfo(const Options& options, const std::string& address);
int createDevice(const Options& options, const std::string& address);
int services(const Options& options, const std::string& address, const std::string& pattern);
int removeDevice(const Options& options, const std::string& address);
int pair(const Options& options, const std::string& address, const AgentOptions& agent);
int standingAgent(const Options& options, const AgentOptions& agent);
int audio(const Options& options, const std::string& action, const std::string& address);
int volume(const Options& options, const std::string& direction, const std::string& address);

int watch(const Options& options);
// scan through the scanner service, which bus activation starts when needed.
int sharedScan(const Options& options, int seconds);

// action: show, enable, disable, add, remove, reload, pause or resume; device
// only for add and remove.
int autoConnect(const Options& options, const std::string& action, const std::string& device);
// wait: short, default or long.
int remoteName(const Options& options, const std::string& address, const std::string& wait);
int restartDaemon(const Options& options);

}  // namespace btbusctl

#endif
