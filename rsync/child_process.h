// One child program run without a shell, in a process group of its own, with its standard output
// and error merged into one pipe that the caller sees line by line. The run can be cancelled: the
// whole group gets SIGTERM, then SIGKILL, and nothing of it survives the call. When the calling
// process dies (even by SIGKILL) the child gets SIGTERM from the kernel; the kernel sends it when
// the forking thread ends, so RunChild must return on the thread that called it (it does: it
// waits for the child itself).
//
// A caller that learns from the child's files that it has everything it needs (a command run's
// reply) may let the child end in the background, but only on a thread inside a LeftRunsScope:
// the child is then left to its thread, which reaps it as soon as it has ended while a later
// RunChild runs, at FinishLeftRuns, and at the latest when the scope ends. Elsewhere (a library
// user's own call) every run is waited for before RunChild returns.
#ifndef S2S_RSYNC_CHILD_PROCESS_H
#define S2S_RSYNC_CHILD_PROCESS_H

#include <boost/function.hpp>
#include <functional>
#include <string>
#include <utility>
#include <vector>

namespace S2S {
namespace rsync_internal {

struct ChildCommand {
    // argv[0] is the program: a path, or a name looked up in PATH.
    std::vector<std::string> argv;
    // Variables set (NAME, value) or removed (NAME, nullopt-like: removed when listed in `unset`)
    // in a copy of this process's environment; secrets travel only this way.
    std::vector<std::pair<std::string, std::string> > set_env;
    std::vector<std::string> unset_env;
    // When `ready` is set: a descriptor that turns readable whenever the child may have produced
    // all the caller needs (an inotify watch), and the test whether it has. Once the test says
    // yes, RunChild returns at once (exit_code 0, left_running) and the child ends in the
    // background; `after_exit` is called once it has been reaped (only then), with its wait
    // status as waitpid gives it, or -1 when it outlasted rsync's own end and was stopped.
    int ready_fd = -1;
    std::function<bool()> ready;
    std::function<void(int status)> after_exit;
};

struct ChildOutcome {
    bool started = false;       // false: the program could not be started (see `error`)
    bool cancelled = false;     // the predicate asked to stop and the group was killed
    int exit_code = -1;         // the exit status; -1 when it died from a signal
    int signal = 0;             // the signal that ended it, if any
    std::string error;          // why it could not be started
    bool left_running = false;  // `ready` said yes: the child was left to end by itself
};

// Lines (split at '\n' and '\r') of the child's merged output; a final unterminated line too.
typedef std::function<void(const std::string& line)> LineSink;

// Polls `cancel` (when set) at least every 200 ms while the child runs, and once more after the
// child has ended but before it is reaped, so the predicate can take a last look at it (the
// bytes it read); that last answer is ignored.
ChildOutcome RunChild(const ChildCommand& job, const boost::function<bool()>& cancel,
                      const LineSink& sink);

// Waits until every child this thread left running has ended (reaped, its `after_exit` called).
// A child that takes longer than rsync's own end would is stopped as a cancelled one is.
void FinishLeftRuns();

// While one lives on a thread, RunChild there may leave children to end in the background; its
// end waits for them (FinishLeftRuns). Scopes nest.
class LeftRunsScope {
  public:
    LeftRunsScope();
    ~LeftRunsScope();
    LeftRunsScope(const LeftRunsScope&) = delete;
    LeftRunsScope& operator=(const LeftRunsScope&) = delete;
};

// The absolute path of `program` (returned as is when it holds a '/'), or "" when PATH has none.
std::string FindProgram(const std::string& program);

}  // namespace rsync_internal
}  // namespace S2S

#endif  // S2S_RSYNC_CHILD_PROCESS_H
