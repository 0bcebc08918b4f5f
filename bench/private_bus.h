#ifndef BTBUS_BENCH_PRIVATE_BUS_H
#define BTBUS_BENCH_PRIVATE_BUS_H

#include <csignal>
#include <string>

#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace btbus_bench {

// Starts a dbus-daemon for a benchmark run (allow-all policy, an abstract
// socket named after tag and this process) and returns its address, "" when it
// cannot; its pid goes to *pid.
inline std::string startBus(const std::string& tag, pid_t* pid) {
    char config[] = "btbus-bench-XXXXXX.conf";
    int fd = mkstemps(config, 5);
    std::string text = "<busconfig><type>session</type><listen>unix:abstract=/btbus/" + tag + "-" +
                       std::to_string(getpid()) +
                       "</listen><auth>EXTERNAL</auth><policy context=\"default\">"
                       "<allow send_destination=\"*\" eavesdrop=\"true\"/><allow eavesdrop=\"true\"/>"
                       "<allow own=\"*\"/></policy></busconfig>";
    if (fd < 0 || write(fd, text.data(), text.size()) < 0) return "";
    close(fd);
    int out[2];
    if (pipe(out) != 0) return "";
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    std::string configArg = std::string("--config-file=") + config;
    char* argv[] = { const_cast<char*>("dbus-daemon"), const_cast<char*>(configArg.c_str()),
                     const_cast<char*>("--nofork"), const_cast<char*>("--print-address=1"), nullptr };
    int failed = posix_spawnp(pid, "dbus-daemon", &actions, nullptr, argv, environ);
    posix_spawn_file_actions_destroy(&actions);
    close(out[1]);
    std::string address;
    char c;
    while (failed == 0 && read(out[0], &c, 1) == 1 && c != '\n') address += c;
    close(out[0]);
    unlink(config);
    return address;
}

inline void stopBus(pid_t pid) {
    if (pid > 0) {
        kill(pid, SIGTERM);
        waitpid(pid, nullptr, 0);
    }
}

}  // namespace btbus_bench

#endif
