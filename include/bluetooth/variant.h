#ifndef BTBUS_BLUETOOTH_VARIANT_H
#define BTBUS_BLUETOOTH_VARIANT_H

#include <string>
#include <utility>
#include <vector>

#include <boost/variant.hpp>

namespace Bluetooth {

// A decoded D-Bus value. The order of the alternatives is part of the interface:
// which() selects the signature written back (see RemoteObject::append) and the
// text form (see util.h).
//   0 UINT32, 1 UINT16, 2 BOOLEAN, 3 STRING or OBJECT_PATH (as text),
//   4 array of strings or object paths, 5 INT16 (sign-extended).
// Beware: Variant(someCharPointer) selects bool, as boost::variant picks the best
// standard conversion; write Variant(std::string(text)) for a string.
typedef boost::variant<unsigned int,
                       unsigned short,
                       bool,
                       std::string,
                       std::vector<std::string>,
                       int>
    Variant;

// One property: its name and value.
typedef std::pair<std::string, Variant> Entry;

// Properties in the order they arrived on the bus; duplicate names are kept.
typedef std::vector<Entry> Dict;

}  // namespace Bluetooth

#endif
