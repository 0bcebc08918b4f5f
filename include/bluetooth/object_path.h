#ifndef BTBUS_BLUETOOTH_OBJECT_PATH_H
#define BTBUS_BLUETOOTH_OBJECT_PATH_H

#include <string>

namespace Bluetooth {

/// A D-Bus object path held as text. No syntax check is made here; appending a
/// path to a call checks that it starts with "/" (RemoteObject::append).
class ObjectPath {
public:
    /// The empty path.
    ObjectPath() {}
    /// text must not be null.
    ObjectPath(const char* text) : text_(text) {}
    /// The path of text.
    ObjectPath(const std::string& text) : text_(text) {}

    /// A copy of other's text.
    ObjectPath& operator=(const ObjectPath& other) {
        text_ = other.text_;
        return *this;
    }

    /// Valid while this object lives and is unchanged; never null.
    ///@{
    operator char const*() const { return text_.c_str(); }
    const char* c_str() const { return text_.c_str(); }
    ///@}

    /// A copy of the text.
    ///@{
    operator std::string() const { return text_; }
    std::string str() const { return text_; }
    ///@}

private:
    std::string text_;
};

}  // namespace Bluetooth

#endif
