// RsyncTask: the rsync wrapper set up the way every run of the sync uses it (deletion, numeric
// ids, the server's authentication and pseudo-root), and its two runs: a share's data transfer and
// a custom-command run, each with its own time limit and the caller's cancel predicate.
#include <boost/function.hpp>
#include <list>
#include <string>

#include "s2s_rsyncer.h"

namespace S2S {

namespace {

// A predicate that calls `cancel`; an empty one (never cancels) when there is none, so that the
// wrapper is never handed a call through a null pointer.
boost::function<bool()> CancelPredicate(bool (*cancel)()) {
    boost::function<bool()> predicate;
    if (cancel != nullptr) {
        predicate = cancel;
    }
    return predicate;
}

// A command must answer quickly; a data transfer may legitimately stall on a slow disk.
constexpr int kCommandTimeoutSeconds = 60;
constexpr int kTransferTimeoutSeconds = 600;

}  // namespace

Rsyncer::RsyncTask::RsyncTask() {
    setDelete(true);
    setNumericIds(true);
    setVurnAuth(true, true);
    setVurnPseudoRoot(true);
}

Rsyncer::RsyncTask::~RsyncTask() = default;

int Rsyncer::RsyncTask::Execute(const std::string& src, const std::string& dst, bool (*cancel)(),
                                const std::string& module, const std::list<std::string>& excludes) {
    setTimeout(kTransferTimeoutSeconds);
    setExcludeRule(excludes);
    setSrcPath(src);
    setDestPath(serverIP, user, password, dst, module);
    return execute(CancelPredicate(cancel));
}

int Rsyncer::RsyncTask::ExecuteCmd(const std::list<std::string>& cmdLines, bool (*cancel)()) {
    setTimeout(kCommandTimeoutSeconds);
    setVurnCustCmdRule(cmdLines);
    setDestPath(serverIP, user, password, "", "");
    return execute(CancelPredicate(cancel));
}

}  // namespace S2S
