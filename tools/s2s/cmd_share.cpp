// s2s share add|remove|list: the share registry of this server. A share is a named folder the
// sync may copy; encrypted shares are copied as their encrypted directory and their key file.
#include <sys/stat.h>

#include <cstdio>
#include <memory>
#include <nlohmann/json.hpp>

#include "platform/records.h"
#include "s2s_platform.h"
#include "tools/s2s/commands.h"
#include "tools/s2s/exit_codes.h"
#include "tools/s2s/options.h"

namespace s2s_cli {

namespace {

using HashPtr = S2S::HashRecord;
using ListPtr = S2S::ListRecord;
using SharePtr = S2S::ShareRecord;

const char kShareHelp[] =
    "Usage: s2s share add NAME --path DIR [OPTIONS]\n"
    "       s2s share remove NAME\n"
    "       s2s share list [--json]\n"
    "\n"
    "Manages the share registry of this server (" S2S_PATH_SHARE_REGISTRY
    ", below $S2S_ROOT when set).\n"
    "Run 's2s share add --help' for the options of a new share.\n";

const std::vector<OptionSpec> kAddOptions = {
    {"path", "DIR", false, "the share's folder (absolute, must exist)"},
    {"encrypted", "", false, "the share is encrypted: its encrypted directory is what is copied"},
    {"encrypted-path", "DIR", false, "the encrypted directory (default: @NAME@ beside the folder)"},
    {"key-file", "FILE", false, "the share's stored key file (default: in the key directory)"},
    {"auto-key-file", "FILE", false, "the key file used for automatic mounting"},
    {"auto-mount", "", false, "the encrypted share is mounted automatically"},
    {"key-len", "N", false, "the encryption key length"},
    {"acl", "", false, "the share uses access control lists"},
    {"win-share", "", false, "the share is a Windows share (counts as an ACL share)"},
    {"replace", "", false, "replace an existing record of the same name"},
    {"help", "", false, "show this help"},
};
const std::vector<OptionSpec> kRemoveOptions = {{"help", "", false, "show this help"}};
const std::vector<OptionSpec> kListOptions = {
    {"json", "", false, "print the registry as JSON"},
    {"help", "", false, "show this help"},
};

std::string PlatformError() {
    const int err = VLIBCErrGet();
    char code[16];
    std::snprintf(code, sizeof(code), "0x%04X", err);
    return std::string(VLIBCErrStr(err)) + " (" + code + ")";
}

bool IsAbsoluteDir(const std::string& path) {
    struct stat st;
    return !path.empty() && path[0] == '/' && stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool ShareExists(const std::string& name) {
    VURNShare* raw = nullptr;
    const int rc = VURNShareGet(name.c_str(), &raw);
    SharePtr share(raw);
    return rc == 0;
}

int AddShare(const Options& opts) {
    std::string error;
    if (opts.Positional().size() != 1) {
        return Fail(kExitUsage, "share add needs exactly one share name");
    }
    const std::string name = opts.Positional()[0];
    if (!VURNShareNameIsValid(name.c_str())) {
        return Fail(kExitUsage, "'" + name +
                                    "' is not a valid share name (1 to 255 bytes of UTF-8, no "
                                    "control characters, none of / \\ [ ], not . or ..)");
    }
    // A valid name the other end could never serve would only fail at the first sync.
    if (VURNShareNameIsSyncable(name.c_str()) != 1) {
        return Fail(kExitUsage, "'" + name +
                                    "' cannot be synced: no quotes, backquotes, %, :, .. or runs "
                                    "of blanks, no leading @, not \"global\"");
    }
    const std::string path = opts.Get("path");
    if (path.empty()) {
        return Fail(kExitUsage, "share add needs --path DIR");
    }
    if (!IsAbsoluteDir(path)) {
        return Fail(kExitUsage, "--path '" + path + "' is not an existing absolute directory");
    }
    const bool encrypted = opts.Has("encrypted");
    for (const char* option : {"encrypted-path", "key-file", "auto-key-file", "auto-mount"}) {
        if (opts.Has(option) && !encrypted) {
            return Fail(kExitUsage, std::string("--") + option + " needs --encrypted");
        }
    }
    for (const char* option : {"encrypted-path", "key-file", "auto-key-file"}) {
        const std::string value = opts.Get(option);
        if (opts.Has(option) && (value.empty() || value[0] != '/')) {
            return Fail(kExitUsage, std::string("--") + option + " needs an absolute path");
        }
    }
    unsigned long long key_len = 0;
    if (opts.Has("key-len") && !opts.GetUnsigned("key-len", 0xFFFFFFFFULL, key_len, error)) {
        return Fail(kExitUsage, error);
    }
    if (!opts.Has("replace") && ShareExists(name)) {
        return Fail(kExitRegistry,
                    "share '" + name + "' is already registered (use --replace to change it)");
    }
    if (encrypted) {
        std::string encrypted_path = opts.Get("encrypted-path");
        if (encrypted_path.empty()) {
            encrypted_path = path.substr(0, path.find_last_of('/') + 1) + "@" + name + "@";
        }
        if (mkdir(encrypted_path.c_str(), 0700) != 0 && !IsAbsoluteDir(encrypted_path)) {
            return Fail(kExitRegistry,
                        "cannot create the encrypted directory '" + encrypted_path + "'");
        }
    }

    HashPtr attrs(VLIBCSzHashAlloc(16));
    if (!attrs) {
        return Fail(kExitInternal, "out of memory");
    }
    VLIBSzHash* raw = attrs.release();
    auto set = [&raw](const char* key, const std::string& value) {
        return VLIBCSzHashSetValue(&raw, key, value.c_str()) == 0;
    };
    bool ok = set("path", path) && set("encrypted", encrypted ? "yes" : "no") &&
              set("auto_mount", opts.Has("auto-mount") ? "yes" : "no") &&
              set("acl", opts.Has("acl") ? "yes" : "no") &&
              set("win_share", opts.Has("win-share") ? "yes" : "no") &&
              set("key_len", std::to_string(key_len));
    if (ok && opts.Has("encrypted-path")) {
        ok = set("encrypted_path", opts.Get("encrypted-path"));
    }
    if (ok && opts.Has("key-file")) {
        ok = set("key_file", opts.Get("key-file"));
    }
    if (ok && opts.Has("auto-key-file")) {
        ok = set("auto_key_file", opts.Get("auto-key-file"));
    }
    attrs.reset(raw);
    if (!ok) {
        return Fail(kExitInternal, "cannot build the share record: " + PlatformError());
    }
    if (VURNShareSet(name.c_str(), attrs.get()) != 0) {
        char other[VURN_SHARE_NAME_MAX + 1];
        if (VLIBCErrGet() == VLIB_ERR_NAME_TAKEN &&
            VURNShareNameCollision(name.c_str(), other, sizeof(other)) == 1) {
            return Fail(kExitRegistry,
                        "share '" + name + "' would be served as the same module as '" + other +
                            "' (names may not differ only in letter case or blanks)");
        }
        return Fail(kExitRegistry, "cannot write share '" + name + "' to " +
                                       S2SPath(S2S_PATH_SHARE_REGISTRY) + ": " + PlatformError());
    }
    std::printf("share '%s' added (%s%s)\n", name.c_str(), path.c_str(),
                encrypted ? ", encrypted" : "");
    return kExitOK;
}

int RemoveShare(const Options& opts) {
    if (opts.Positional().size() != 1) {
        return Fail(kExitUsage, "share remove needs exactly one share name");
    }
    const std::string name = opts.Positional()[0];
    if (VURNShareRemove(name.c_str()) != 0) {
        if (VLIBCErrGet() == VLIB_ERR_NOT_FOUND) {
            return Fail(kExitRegistry, "no share named '" + name + "' is registered");
        }
        return Fail(kExitRegistry, "cannot remove share '" + name + "': " + PlatformError());
    }
    std::printf("share '%s' removed (its files stay)\n", name.c_str());
    return kExitOK;
}

int ListShares(const Options& opts) {
    if (!opts.Positional().empty()) {
        return Fail(kExitUsage, "share list takes no arguments");
    }
    ListPtr names(VLIBCSzListAlloc(16));
    if (!names) {
        return Fail(kExitInternal, "out of memory");
    }
    VLIBSzList* raw = names.release();
    const int count = VURNShareEnum(&raw);
    names.reset(raw);
    if (count < 0) {
        if (VLIBCErrGet() != VLIB_ERR_FILE_NOT_FOUND) {
            return Fail(kExitRegistry, std::string("cannot read the share registry ") +
                                           S2SPath(S2S_PATH_SHARE_REGISTRY) + ": " +
                                           PlatformError());
        }
    }
    nlohmann::json list = nlohmann::json::array();
    for (int i = 0; i < VLIBCSzListCount(names.get()); ++i) {
        const std::string name = VLIBCSzListGet(names.get(), i);
        VURNShare* share_raw = nullptr;
        const int rc = VURNShareGet(name.c_str(), &share_raw);
        SharePtr share(share_raw);
        nlohmann::json entry = {{"name", name}};
        if (rc == 0) {
            entry["path"] = share->path;
            entry["encrypted"] = (share->status & VURN_SHARE_STATUS_ENCRYPTED) != 0;
            entry["auto_mount"] = (share->status & VURN_SHARE_STATUS_AUTO_MOUNT) != 0;
            entry["acl"] = (share->status & VURN_SHARE_STATUS_ACL) != 0;
            entry["win_share"] = (share->status & VURN_SHARE_STATUS_WIN_SHARE) != 0;
        } else {
            entry["error"] = PlatformError();
        }
        list.push_back(entry);
    }
    if (opts.Has("json")) {
        std::printf("%s\n", list.dump(2).c_str());
        return kExitOK;
    }
    if (list.empty()) {
        std::printf("no shares registered\n");
        return kExitOK;
    }
    for (const auto& entry : list) {
        if (entry.contains("error")) {
            std::printf("%-20s (unreadable record: %s)\n", entry["name"].get<std::string>().c_str(),
                        entry["error"].get<std::string>().c_str());
            continue;
        }
        std::string flags;
        for (const char* flag : {"encrypted", "auto_mount", "acl", "win_share"}) {
            if (entry[flag].get<bool>()) {
                flags += flags.empty() ? " [" : ", ";
                flags += flag;
            }
        }
        if (!flags.empty()) {
            flags += "]";
        }
        std::printf("%-20s %s%s\n", entry["name"].get<std::string>().c_str(),
                    entry["path"].get<std::string>().c_str(), flags.c_str());
    }
    return kExitOK;
}

}  // namespace

std::string ShareHelp() {
    return kShareHelp;
}

std::vector<Command> ShareCommands() {
    return {
        {"add", "s2s share add NAME --path DIR [OPTIONS]",
         "Adds a share to the registry. The folder must exist; an encrypted share's\n"
         "encrypted directory is created when missing.",
         kAddOptions, "", AddShare},
        {"remove", "s2s share remove NAME",
         "Removes a share from the registry. Its folder and files stay.", kRemoveOptions, "",
         RemoveShare},
        {"list", "s2s share list [--json]", "Lists the registered shares.", kListOptions, "",
         ListShares},
    };
}

}  // namespace s2s_cli
