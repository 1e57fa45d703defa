// The reader of the request lines clients send on the daemon's socket.
#ifndef ZORVNOTIFYD_DAEMON_REQUEST_H_
#define ZORVNOTIFYD_DAEMON_REQUEST_H_

#include <string>

#include <json/json.h>

namespace zorvnotifyd {

// How deep a request line may nest.  A request is a flat object; this
// leaves room for members the daemon ignores.
constexpr int kMaxRequestDepth = 8;

// Parses |line| into |request|; false when it is not one JSON object
// nested at most kMaxRequestDepth levels.  jsoncpp's reader, which the
// tool and the library use too, recurses once per level and throws past
// its stack limit: here the strict reader gets a small limit, and whatever
// it throws (that, or memory running out) makes a bad request, never the
// end of the daemon.  A parser of its own for one flat object would be
// more code to get right for no gain.  The caller bounds the line's
// length, and so the memory the parsed value takes.
bool ParseRequest(const std::string& line, Json::Value* request) noexcept;

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_REQUEST_H_
