// VURN::Backup::RsyncWrapper: one rsync run over the stock rsync binary. The sync driver's
// RsyncTask derives from it; the wrapper owns the command line, the authentication with the
// server and the delivery of custom command lines to the server's command handler.
#ifndef S2S_RSYNC_WRAPPER_H
#define S2S_RSYNC_WRAPPER_H

#include <boost/function.hpp>
#include <list>
#include <string>

#include "s2s_export.h"

namespace VURN {
namespace Backup {

class S2S_EXPORT RsyncWrapper {
  public:
    RsyncWrapper();
    virtual ~RsyncWrapper();
    RsyncWrapper(const RsyncWrapper&) = delete;
    RsyncWrapper& operator=(const RsyncWrapper&) = delete;

    void setSrcPath(std::string path);
    void setDestPath(std::string server, std::string user, std::string password, std::string dest,
                     std::string module);
    void setSsh(bool on);
    void setPort(int port);
    void setCompress(bool on);
    void setDeltaCopy(bool on);
    void setListOnly(bool on);
    void setRelativePath(bool on);
    void setNumericIds(bool on);
    void setDelete(bool on);
    void setTimeout(int seconds);
    void setDebugLog(bool on);
    void setExcludeRule(std::list<std::string> rules);
    void setVurnAcl(bool on);
    void setVurnAuth(bool on, bool strict);
    void setVurnPseudoRoot(bool on);
    void setVurnCustCmdRule(std::list<std::string> lines);

    // Runs rsync with these settings; polls `cancel` (when set) at least every 200 ms and stops
    // the run when it returns true. 0, or rsync's / the server's numeric result code.
    int execute(boost::function<bool()> cancel);
};

}  // namespace Backup
}  // namespace VURN

#endif  // S2S_RSYNC_WRAPPER_H
