#include "support/namespace.h"

#include <cstdlib>
#include <set>
#include <vector>

#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include "support/process.h"

namespace btbus_test {

namespace {

bool failed(std::string& why, const std::string& what) {
    why = what;
    return false;
}

bool tmpfs(const std::string& directory, std::string& why, const char* options = "size=16m") {
    return mount("tmpfs", directory.c_str(), "tmpfs", 0, options) == 0 || failed(why, "cannot mount a tmpfs on " + directory);
}

}  // namespace

bool inPrivateNamespace(std::string& skip) {
    const std::vector<std::string> unshare = { "unshare", "-m", "-p", "-f", "--mount-proc" };
    std::string probe;
    for (const std::string& word : unshare) probe += word + " ";
    if (childRole().empty() && (geteuid() != 0 || std::system((probe + "true >/dev/null 2>&1").c_str()) != 0)) {
        skip = "needs root and '" + probe + "' to keep the host's /proc, /tmp, /etc and /usr out of reach";
        return false;
    }
    return inOwnProcess(unshare);
}

bool overlay(const std::string& directory, std::string& why) {
    std::string base = scratchDir() + "/overlay" + directory;
    for (std::string::size_type at = base.find('/', 1); at != std::string::npos; at = base.find('/', at + 1))
        mkdir(base.substr(0, at).c_str(), 0755);
    mkdir(base.c_str(), 0700);
    // The upper directory must not be on an overlay itself: a tmpfs.
    if (!tmpfs(base, why)) return false;
    mkdir((base + "/upper").c_str(), 0755);
    mkdir((base + "/work").c_str(), 0755);
    std::string options = "lowerdir=" + directory + ",upperdir=" + base + "/upper,workdir=" + base + "/work";
    return mount("overlay", directory.c_str(), "overlay", 0, options.c_str()) == 0 ||
           failed(why, "cannot mount an overlay on " + directory);
}

bool privateTmp(const std::vector<std::string>& keep, std::string& why) {
    std::set<std::string> trees;  // the entries of /tmp that hold what is kept
    for (const std::string& path : keep) {
        char* real = realpath(path.c_str(), nullptr);
        std::string found = real != nullptr ? real : "";
        std::free(real);
        if (found.compare(0, 5, "/tmp/") == 0) trees.insert(found.substr(0, found.find('/', 5)));
    }
    // Put together aside, then moved onto /tmp.
    std::string fresh = scratchDir() + "/private-tmp";
    mkdir(fresh.c_str(), 0755);
    if (!tmpfs(fresh, why, "size=16m,mode=1777")) return false;
    for (const std::string& tree : trees) {
        std::string at = fresh + tree.substr(4);
        mkdir(at.c_str(), 0755);
        if (mount(tree.c_str(), at.c_str(), nullptr, MS_BIND, nullptr) != 0)
            return failed(why, "cannot bind " + tree + " into the private /tmp");
    }
    return mount(fresh.c_str(), "/tmp", nullptr, MS_MOVE, nullptr) == 0 ||
           failed(why, "cannot move the private tmpfs onto /tmp");
}

bool privateSystemDirectories(std::string& why) {
    // A checkout or a build tree cloned under /tmp stays reachable.
    if (!privateTmp({ BTBUS_SOURCE_DIR, BTBUS_TEST_TMP, "/proc/self/exe" }, why) || !overlay("/etc", why) || !overlay("/usr/sbin", why)) return false;
    mkdir("/etc/bluetooth", 0755);
    return tmpfs("/etc/bluetooth", why);
}

}  // namespace btbus_test
