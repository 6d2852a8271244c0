// Share records from the share registry (a section file with one section per share).
#include <errno.h>

#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

#include "core/protocol.h"
#include "platform/env.h"
#include "platform/platform_internal.h"
#include "platform/section_file.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

using S2S::Logger;
using s2s_platform::Fail;
using s2s_platform::Pairs;
using s2s_platform::SectionDoc;
using s2s_platform::Succeed;

namespace {

const char* const kBoolKeys[] = {"encrypted", "auto_mount",  "acl",
                                 "win_share", "in_sharebin", "special_files"};
const char* const kPathKeys[] = {"path", "encrypted_path", "key_file", "auto_key_file"};

std::string RegistryPath() {
    const char* path = S2SPath(S2S_PATH_SHARE_REGISTRY);
    return path == nullptr ? std::string() : path;
}

// The share-name rules are the exchange's own: the receiving daemon serves each share as a
// module of its name, so the registry and both ends of a sync share one rule.
static_assert(VURN_SHARE_NAME_MAX == S2S::protocol::kShareNameMax, "one share name length");

bool ValidShareName(const char* name) {
    return name != nullptr && S2S::protocol::ShareNameValid(name);
}

std::string ModuleKey(const std::string& name) {
    return S2S::protocol::ShareModuleKey(name);
}

// The registered share, other than `name` itself, that would be served as the same module.
std::string CollidingShare(const SectionDoc& doc, const std::string& name) {
    const std::string key = ModuleKey(name);
    for (const std::string& other : doc.SectionNames()) {
        if (other != name && ModuleKey(other) == key) {
            return other;
        }
    }
    return std::string();
}

bool ParseBool(const std::string& text, bool& value) {
    if (text == "yes") {
        value = true;
        return true;
    }
    if (text == "no" || text.empty()) {
        value = false;
        return true;
    }
    return false;
}

bool ParseKeyLen(const std::string& text, unsigned int& value) {
    if (text.empty()) {
        value = 0;
        return true;
    }
    if (text.size() > 9 || text.find_first_not_of("0123456789") != std::string::npos) {
        return false;
    }
    value = static_cast<unsigned int>(std::strtoul(text.c_str(), nullptr, 10));
    return true;
}

bool ValidPathValue(const std::string& text) {
    return text.empty() || text[0] == '/';
}

int BadRecord(int line, const std::string& share, const char* key, const std::string& value) {
    Logger::LogMsg(Logger::Error,
                   "[ERROR] share_registry.cpp(%d): Share '%s' has an invalid %s '%s' in '%s'\n",
                   line, share.c_str(), key, value.c_str(), RegistryPath().c_str());
    return Fail(VLIB_ERR_BAD_FORMAT);
}

// Loads the registry; a missing one is logged here (shares must be registered to exist).
int LoadRegistry(SectionDoc& doc) {
    std::string path = RegistryPath();
    if (path.empty()) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    if (s2s_platform::LoadSectionFile(path, doc) != 0) {
        if (VLIBCErrGet() == VLIB_ERR_FILE_NOT_FOUND) {
            Logger::LogMsg(Logger::Error,
                           "[ERROR] share_registry.cpp(%d): Share registry '%s' does not exist\n",
                           __LINE__, path.c_str());
        }
        return -1;
    }
    return 0;
}

std::string Lookup(const Pairs& pairs, const char* key) {
    for (const auto& pair : pairs) {
        if (pair.first == key) {
            return pair.second;
        }
    }
    return std::string();
}

struct Record {
    std::string name;
    std::string path;
    unsigned int status = 0;
    unsigned int key_len = 0;
    std::string encrypted_path;
    std::string key_file;
    std::string auto_key_file;
    bool in_sharebin = false;
};

int DecodeRecord(const std::string& name, const Pairs& pairs, Record& rec) {
    rec.name = name;
    for (const char* key : kPathKeys) {
        std::string value = Lookup(pairs, key);
        if (!ValidPathValue(value)) {
            return BadRecord(__LINE__, name, key, value);
        }
    }
    rec.path = Lookup(pairs, "path");
    rec.encrypted_path = Lookup(pairs, "encrypted_path");
    rec.key_file = Lookup(pairs, "key_file");
    rec.auto_key_file = Lookup(pairs, "auto_key_file");
    static const struct {
        const char* key;
        unsigned int bit;
    } kBits[] = {{"encrypted", VURN_SHARE_STATUS_ENCRYPTED},
                 {"auto_mount", VURN_SHARE_STATUS_AUTO_MOUNT},
                 {"acl", VURN_SHARE_STATUS_ACL},
                 {"win_share", VURN_SHARE_STATUS_WIN_SHARE},
                 {"special_files", VURN_SHARE_STATUS_SPECIAL_FILES}};
    for (const auto& bit : kBits) {
        bool on = false;
        std::string value = Lookup(pairs, bit.key);
        if (!ParseBool(value, on)) {
            return BadRecord(__LINE__, name, bit.key, value);
        }
        rec.status |= on ? bit.bit : 0;
    }
    std::string value = Lookup(pairs, "in_sharebin");
    if (!ParseBool(value, rec.in_sharebin)) {
        return BadRecord(__LINE__, name, "in_sharebin", value);
    }
    value = Lookup(pairs, "key_len");
    if (!ParseKeyLen(value, rec.key_len)) {
        return BadRecord(__LINE__, name, "key_len", value);
    }
    return 0;
}

int LoadRecord(const char* name, Record& rec) {
    if (!ValidShareName(name)) {
        Logger::LogMsg(Logger::Error, "[ERROR] share_registry.cpp(%d): Invalid share name\n",
                       __LINE__);
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    SectionDoc doc;
    if (LoadRegistry(doc) != 0) {
        return -1;
    }
    if (!doc.HasSection(name)) {
        return Fail(VLIB_ERR_NOT_FOUND);
    }
    return DecodeRecord(name, doc.SectionPairs(name), rec);
}

char* Dup(const std::string& text) {
    return strdup(text.c_str());
}

std::string StripSlashes(std::string path) {
    while (path.size() > 1 && path.back() == '/') {
        path.pop_back();
    }
    return path;
}

// Where an encrypted share keeps its ciphertext when the registry does not say: a directory
// "@<name>@" beside the share's mount path.
std::string DefaultEncryptedPath(const std::string& name, const std::string& path) {
    std::string clean = StripSlashes(path);
    size_t slash = clean.find_last_of('/');
    std::string dir = slash == std::string::npos || slash == 0 ? "" : clean.substr(0, slash);
    return dir + "/@" + name + "@";
}

std::string KeyDir() {
    const char* dir = S2SPath(S2S_PATH_KEY_DIR);
    return dir == nullptr ? std::string() : dir;
}

}  // namespace

extern "C" {

int VURNShareNameIsValid(const char* name) {
    return ValidShareName(name) ? 1 : 0;
}

int VURNShareNameIsSyncable(const char* name) {
    try {
        return name != nullptr && S2S::protocol::ShareNameSyncable(name) ? 1 : 0;
    } catch (const std::bad_alloc&) {
        return 0;
    }
}

int VURNShareModuleKey(const char* name, char* buf, int size) {
    if (name == nullptr || buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        return s2s_platform::CopyOut(ModuleKey(name), buf, size);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VURNShareNameCollision(const char* name, char* buf, int size) {
    if (name == nullptr || buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        SectionDoc doc;
        if (LoadRegistry(doc) != 0) {
            return VLIBCErrGet() == VLIB_ERR_FILE_NOT_FOUND ? Succeed(0) : -1;
        }
        std::string other = CollidingShare(doc, name);
        if (other.empty()) {
            buf[0] = '\0';
            return Succeed(0);
        }
        return s2s_platform::CopyOut(other, buf, size) < 0 ? -1 : Succeed(1);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VURNShareGet(const char* name, VURNShare** share) {
    if (share == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    *share = nullptr;
    try {
        Record rec;
        if (LoadRecord(name, rec) != 0) {
            return -1;
        }
        // A C record: the caller releases it with VURNShareFree, which frees each string.
        VURNShare* out = static_cast<VURNShare*>(std::calloc(1, sizeof(VURNShare)));
        if (out == nullptr) {
            return Fail(VLIB_ERR_OUT_OF_MEMORY);
        }
        out->name = Dup(rec.name);
        out->path = Dup(rec.path);
        out->encryptedPath = Dup(rec.encrypted_path);
        out->keyFile = Dup(rec.key_file);
        out->autoKeyFile = Dup(rec.auto_key_file);
        out->status = rec.status;
        out->keyLen = rec.key_len;
        out->inSharebin = rec.in_sharebin ? 1 : 0;
        if (out->name == nullptr || out->path == nullptr || out->encryptedPath == nullptr ||
            out->keyFile == nullptr || out->autoKeyFile == nullptr) {
            VURNShareFree(out);
            return Fail(VLIB_ERR_OUT_OF_MEMORY);
        }
        *share = out;
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(0);
}

void VURNShareFree(VURNShare* share) {
    if (share == nullptr) {
        return;
    }
    std::free(share->name);
    std::free(share->path);
    std::free(share->encryptedPath);
    std::free(share->keyFile);
    std::free(share->autoKeyFile);
    std::free(share);
}

int VLIBShareEncryptPathGet(const char* sharePath, char* buf, int size) {
    if (sharePath == nullptr || sharePath[0] != '/' || buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        SectionDoc doc;
        if (LoadRegistry(doc) != 0) {
            return -1;
        }
        std::string wanted = StripSlashes(sharePath);
        for (const std::string& name : doc.SectionNames()) {
            Pairs pairs = doc.SectionPairs(name);
            std::string path = Lookup(pairs, "path");
            if (path.empty() || StripSlashes(path) != wanted || !ValidShareName(name.c_str())) {
                continue;
            }
            Record rec;
            if (DecodeRecord(name, pairs, rec) != 0) {
                return -1;
            }
            std::string encrypted = rec.encrypted_path.empty()
                                        ? DefaultEncryptedPath(name, rec.path)
                                        : rec.encrypted_path;
            return s2s_platform::CopyOut(encrypted, buf, size);
        }
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    buf[0] = '\0';
    return Fail(VLIB_ERR_NOT_FOUND);
}

int VURNShareIsInSharebin(const char* name) {
    try {
        Record rec;
        if (LoadRecord(name, rec) != 0) {
            return -1;
        }
        return Succeed(rec.in_sharebin ? 1 : 0);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VLIBShareIsEncryptionGet(const VURNShare* share, int* value) {
    if (share == nullptr || value == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    *value = (share->status & VURN_SHARE_STATUS_ENCRYPTED) != 0 ? 1 : 0;
    return Succeed(0);
}

int VLIBShareIsAutoDecryptGet(const VURNShare* share, int* value) {
    if (share == nullptr || value == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    *value = (share->status & VURN_SHARE_STATUS_AUTO_MOUNT) != 0 ? 1 : 0;
    return Succeed(0);
}

int VURNShareEncKeyFileGet(const VURNShare* share, char* buf, int size) {
    if (share == nullptr || share->name == nullptr || buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        std::string path = share->keyFile != nullptr && share->keyFile[0] != '\0'
                               ? std::string(share->keyFile)
                               : KeyDir() + "/" + share->name + ".key";
        return s2s_platform::CopyOut(path, buf, size);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VURNShareEncAutoKeyFileGet(const VURNShare* share, char* buf, int size) {
    if (share == nullptr || share->name == nullptr || buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        std::string path = share->autoKeyFile != nullptr && share->autoKeyFile[0] != '\0'
                               ? std::string(share->autoKeyFile)
                               : KeyDir() + "/" + share->name + ".auto.key";
        return s2s_platform::CopyOut(path, buf, size);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VURNShareSet(const char* name, const VLIBSzHash* attrs) {
    if (!ValidShareName(name) || attrs == nullptr) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] share_registry.cpp(%d): Invalid share name or attributes\n",
                       __LINE__);
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        Pairs pairs;
        int count = VLIBCSzHashCount(attrs);
        for (int i = 0; i < count; ++i) {
            std::string key = VLIBCSzHashKeyAt(attrs, i);
            std::string value = VLIBCSzHashValueAt(attrs, i);
            bool known = key == "key_len";
            for (const char* k : kBoolKeys) {
                known = known || key == k;
            }
            for (const char* k : kPathKeys) {
                known = known || key == k;
            }
            if (!known || !s2s_platform::ValidValue(value.c_str())) {
                Logger::LogMsg(Logger::Error,
                               "[ERROR] share_registry.cpp(%d): Share '%s': unknown or unstorable "
                               "attribute '%s'\n",
                               __LINE__, name, key.c_str());
                return Fail(VLIB_ERR_BAD_PARAMETER);
            }
            pairs.emplace_back(key, value);
        }
        Record rec;
        if (DecodeRecord(name, pairs, rec) != 0) {
            return Fail(VLIB_ERR_BAD_PARAMETER);
        }
        std::string path = RegistryPath();
        size_t slash = path.find_last_of('/');
        if (slash != std::string::npos && slash > 0 &&
            s2s_platform::Env::Default()->MakeDirs(path.substr(0, slash)) != 0) {
            int saved = errno;
            Logger::LogMsg(Logger::Error,
                           "[ERROR] share_registry.cpp(%d): Fail to create the directory of '%s', "
                           "error:'%s'\n",
                           __LINE__, path.c_str(), std::strerror(saved));
            return Fail(s2s_platform::ErrorFromErrno(saved));
        }
        int rc = s2s_platform::UpdateSectionFile(path, true, [&](SectionDoc& doc) {
            // Decided under the registry's write lock: two adds racing cannot both pass.
            std::string other = CollidingShare(doc, name);
            if (!other.empty()) {
                Logger::LogMsg(Logger::Error,
                               "[ERROR] share_registry.cpp(%d): Share '%s' would be served as the "
                               "same module as share '%s'\n",
                               __LINE__, name, other.c_str());
                return Fail(VLIB_ERR_NAME_TAKEN);
            }
            if (!doc.ReplacePairs(name, pairs)) {
                doc.AppendSection(name, pairs);
            }
            return 1;
        });
        return rc < 0 ? -1 : Succeed(0);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VURNShareRemove(const char* name) {
    if (!ValidShareName(name)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    std::string path = RegistryPath();
    int rc = s2s_platform::UpdateSectionFile(
        path, false, [&](SectionDoc& doc) { return doc.RemoveSection(name) ? 1 : 0; });
    if (rc == 0) {
        return Fail(VLIB_ERR_NOT_FOUND);
    }
    if (rc < 0 && VLIBCErrGet() == VLIB_ERR_FILE_NOT_FOUND) {
        return Fail(VLIB_ERR_NOT_FOUND);
    }
    return rc < 0 ? -1 : Succeed(0);
}

int VURNShareEnum(VLIBSzList** names) {
    if (names == nullptr || *names == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        SectionDoc doc;
        if (LoadRegistry(doc) != 0) {
            return -1;
        }
        int count = 0;
        for (const std::string& name : doc.SectionNames()) {
            if (VLIBCSzListPush(names, name.c_str()) < 0) {
                return -1;
            }
            ++count;
        }
        return Succeed(count);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

}  // extern "C"
