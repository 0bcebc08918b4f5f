#ifndef BTBUS_TESTS_SUPPORT_NAMESPACE_H
#define BTBUS_TESTS_SUPPORT_NAMESPACE_H

#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace btbus_test {

// Whether this process runs the current test in a private mount and process
// namespace (unshare -m -p, a /proc of its own). In the parent it runs the
// current test again in such a child of this binary, expects it to pass, and
// returns false with skip empty; when the machine forbids that it returns false
// with skip saying why.
bool inPrivateNamespace(std::string& skip);

// Mounts a writable overlay on directory, its changes kept on a tmpfs; only
// this namespace sees them. False with why set on failure.
bool overlay(const std::string& directory, std::string& why);

// In a private namespace: an empty tmpfs on /tmp but for the entries of /tmp
// that hold the paths in keep, bound back in at their own paths. False with
// why set on failure.
bool privateTmp(const std::vector<std::string>& keep, std::string& why);

// In a private namespace: a private /tmp that keeps this test's trees,
// /etc/bluetooth empty, /usr/sbin writable. False with why set on failure.
bool privateSystemDirectories(std::string& why);

}  // namespace btbus_test

// The rest of the test runs in a private namespace (see inPrivateNamespace).
#define BTBUS_IN_PRIVATE_NAMESPACE()                                  \
    do {                                                              \
        std::string skip_;                                            \
        if (!::btbus_test::inPrivateNamespace(skip_)) {               \
            if (!skip_.empty()) GTEST_SKIP() << skip_;                \
            return;                                                   \
        }                                                             \
    } while (0)

#endif
