// How `s2s` asks the sync service s2sd: one request map over the control socket, one reply map
// back (docs/service.md), and what the outcome means for the exit code.
#ifndef S2S_TOOLS_S2S_CONTROL_CLIENT_H
#define S2S_TOOLS_S2S_CONTROL_CLIENT_H

#include <string>

#include "s2s_pobject.h"
#include "tools/s2s/exit_codes.h"

namespace s2s_cli {

// One exchange with s2sd: 0 when a reply came back (whatever its status), -1 with `error` set
// when none did. The only place that touches the socket.
int ControlRequest(const S2S::PObject& request, S2S::PObject& reply, std::string& error);

// Sends `request` and judges the answer. On a reply with status 0, `reply` holds it and the
// result is kExitOK. Otherwise the reason is printed ("s2s: ...") and the result is the exit
// class: kExitNoService when s2sd is not running, else the class of the reply's status.
int AskService(const S2S::PObject& request, S2S::PObject& reply);

// The exit class of a control status code (an unknown code is kExitService).
ExitCode ExitForControlStatus(unsigned long long status);
// "no-such-task (3)" and the like.
std::string ControlStatusName(unsigned long long status);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_CONTROL_CLIENT_H
