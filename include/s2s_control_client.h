// The front ends' side of the sync service's control socket: one request map out, one reply map
// back, on a connection of its own (docs/service.md describes the commands and replies).
#ifndef S2S_CONTROL_CLIENT_H
#define S2S_CONTROL_CLIENT_H

#include <string>

#include "s2s_export.h"
#include "s2s_pobject.h"

namespace S2S {
namespace Control {

// How long a request waits for the service: connecting, sending, and each stretch of the reply.
constexpr unsigned kRequestTimeoutSeconds = 30;

// Sends `request` to s2sd at S2SPath(kSocketPath) and waits for its reply. 0 when a reply map
// with a status arrived (the status may still say that the request failed; see Status in
// s2s_control.h); -1 with `error` set to a sentence for a person when the service is not running,
// did not answer or answered with something that is not a reply. A service that accepts the
// connection and then stays silent for `timeout_seconds` (at least 1) is given up on.
S2S_EXPORT int Request(const PObject& request, PObject& reply, std::string& error,
                       unsigned timeout_seconds = kRequestTimeoutSeconds);

}  // namespace Control
}  // namespace S2S

#endif  // S2S_CONTROL_CLIENT_H
