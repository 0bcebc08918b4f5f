#ifndef BTBUS_BLUETOOTH_VARIANT_H
#define BTBUS_BLUETOOTH_VARIANT_H

#include <string>
#include <utility>
#include <vector>

#include <boost/variant.hpp>

namespace Bluetooth {

typedef boost::variant<unsigned int,
                       unsigned short,
                       bool,
                       std::string,
                       std::vector<std::string>,
                       int>
    VariantBase;

/// A decoded D-Bus value. The order of the alternatives is part of the interface:
/// which() selects the signature written back (see RemoteObject::append) and the
/// text form (see util.h).
///   0 UINT32, 1 UINT16, 2 BOOLEAN, 3 STRING or OBJECT_PATH (as text),
///   4 array of strings or object paths, 5 INT16 (sign-extended).
/// It is the boost::variant above in all but one respect: text given as a
/// character pointer is held as a string (the template alone would make it a bool).
class Variant : public VariantBase {
public:
    /// Alternative 0 with the value 0.
    Variant() : VariantBase() {}
    /// The value of each alternative; text (null as "") is the string one.
    ///@{
    Variant(const VariantBase& other) : VariantBase(other) {}
    Variant(unsigned int value) : VariantBase(value) {}
    Variant(unsigned short value) : VariantBase(value) {}
    Variant(bool value) : VariantBase(value) {}
    Variant(const std::string& value) : VariantBase(value) {}
    Variant(std::string&& value) : VariantBase(std::move(value)) {}
    Variant(const char* text) : VariantBase(std::string(text != 0 ? text : "")) {}
    Variant(const std::vector<std::string>& value) : VariantBase(value) {}
    Variant(std::vector<std::string>&& value) : VariantBase(std::move(value)) {}
    Variant(int value) : VariantBase(value) {}
    ///@}

    /// Holds text (null as "") as the string alternative.
    Variant& operator=(const char* text) {
        VariantBase::operator=(std::string(text != 0 ? text : ""));
        return *this;
    }
    /// Holds value, as the constructor of its type would.
    template <typename T>
    Variant& operator=(T&& value) {
        Variant converted(std::forward<T>(value));
        VariantBase::operator=(std::move(static_cast<VariantBase&>(converted)));
        return *this;
    }

    /// Compared as boost::variant compares: the alternative first, then the value.
    ///@{
    bool operator==(const Variant& other) const { return base() == other.base(); }
    bool operator!=(const Variant& other) const { return !(base() == other.base()); }
    bool operator<(const Variant& other) const { return base() < other.base(); }
    ///@}

private:
    const VariantBase& base() const { return *this; }
};

/// One property: its name and value.
typedef std::pair<std::string, Variant> Entry;

/// Properties in the order they arrived on the bus; duplicate names are kept.
typedef std::vector<Entry> Dict;

}  // namespace Bluetooth

#endif
