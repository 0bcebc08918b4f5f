#ifndef BTBUS_SRC_CORE_CALL_H
#define BTBUS_SRC_CORE_CALL_H

#include <mutex>

#include <bluetooth/remote_object.h>

#include "core/log.h"

namespace Bluetooth {
namespace internal {

// How an operation sends its call: without waiting (a refusal is never seen),
// blocking for the reply, or pending while this thread keeps dispatching the
// connection (so that the process's own agent can answer meanwhile).
enum Send { kOneWay, kWaitReply, kPending };

// One proxy operation: its method, how it sends, and the line its failure is
// logged at (pinned: it is part of the log's contract); kSilent for an
// operation whose caller asked for no log line.
enum { kSilent = 0 };
struct Op {
    const char* method;
    Send send;
    int logLine;
};

// An object-path argument given as text that may be null: null is reported
// as error 1, like any null argument, since an ObjectPath cannot hold it.
struct PathText {
    explicit PathText(const char* text) : text(text) {}
    const char* text;
};

template <typename A>
int appendOne(RemoteObject& object, const A& value) {
    return object.append(value);
}

inline int appendOne(RemoteObject& object, const PathText& path) {
    return path.text != 0 ? object.append(ObjectPath(path.text))
                          : object.append(static_cast<const char*>(0));
}

// Output type of operations that read no reply.
struct NoReply {};
static NoReply* const kNoReply = 0;

inline int appendAll(RemoteObject&) { return 0; }

template <typename A, typename... Rest>
int appendAll(RemoteObject& object, const A& first, const Rest&... rest) {
    if (appendOne(object, first) != 0) return -1;  // stops at the first failure
    return appendAll(object, rest...);
}

inline int readReply(RemoteObject&, NoReply*) { return 0; }

template <typename Out>
int readReply(RemoteObject& object, Out* out) {
    return object.getReplyValue(*out);
}

// Marks an operation running on an object: a signal's decoding error, noted on
// the object from a receiving thread meanwhile, does not change its outcome.
class OperationScope {
public:
    explicit OperationScope(RemoteObject& object) : object_(object) {
        std::lock_guard<std::mutex> hold(object_.errorLock);
        ++object_.operationDepth;
    }
    ~OperationScope() {
        std::lock_guard<std::mutex> hold(object_.errorLock);
        --object_.operationDepth;
    }
    OperationScope(const OperationScope&) = delete;
    OperationScope& operator=(const OperationScope&) = delete;

private:
    RemoteObject& object_;
};

// The frame every proxy operation runs: reset the error state, build the call,
// append the arguments, send it, read the reply if it waits for one, and log the
// error text once. Returns 0, or the first failing step's result (-1, or -2
// from an object-path reply that carried an error text).
template <typename Out, typename... A>
int call(RemoteObject& object, const char* file, const Op& op, Out* out, const A&... args) {
    OperationScope running(object);
    object.resetError();
    int result = object.newMessage(op.method);
    if (result == 0) result = appendAll(object, args...);
    if (result == 0)
        result = op.send == kPending ? object.sendMessagePending()
                                     : object.sendMessage(op.send == kWaitReply, -1);
    if (result == 0 && op.send != kOneWay) result = readReply(object, out);
    if (object.hasError() && op.logLine != kSilent)
        logError(file, op.logLine, "%s", object.getErrorMessage().c_str());
    return result;
}

}  // namespace internal
}  // namespace Bluetooth

#endif
