// The per-thread last platform error, and small helpers the platform sources share.
#include <errno.h>

#include <cstring>

#include "platform/platform_internal.h"
#include "s2s_platform.h"

namespace s2s_platform {

// Not in an anonymous namespace: the exported C accessors below reach it by name.
thread_local int last_error = VLIB_ERR_NONE;

void SetError(int err) {
    last_error = err;
}

int Fail(int err) {
    last_error = err;
    return -1;
}

int Succeed(int result) {
    last_error = VLIB_ERR_NONE;
    return result;
}

int ErrorFromErrno(int errnum) {
    switch (errnum) {
        case ENOENT:
        case ENOTDIR:
            return VLIB_ERR_FILE_NOT_FOUND;
        case EACCES:
        case EPERM:
        case EROFS:
            return VLIB_ERR_ACCESS;
        case ENOMEM:
            return VLIB_ERR_OUT_OF_MEMORY;
        default:
            return VLIB_ERR_IO;
    }
}

std::string Trim(const std::string& text) {
    const char* blanks = " \t\r\n";
    size_t begin = text.find_first_not_of(blanks);
    if (begin == std::string::npos) {
        return std::string();
    }
    size_t end = text.find_last_not_of(blanks);
    return text.substr(begin, end - begin + 1);
}

int CopyOut(const std::string& value, char* buf, int size) {
    if (buf == nullptr || size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    if (value.size() >= static_cast<size_t>(size)) {
        buf[0] = '\0';
        return Fail(VLIB_ERR_BUFFER_TOO_SMALL);
    }
    std::memcpy(buf, value.c_str(), value.size() + 1);
    return Succeed(static_cast<int>(value.size()));
}

}  // namespace s2s_platform

extern "C" {

int VLIBCErrGet(void) {
    return s2s_platform::last_error;
}

void VLIBCErrSet(int err) {
    s2s_platform::last_error = err;
}

const char* VLIBCErrStr(int err) {
    switch (err) {
        case VLIB_ERR_NONE:
            return "Success";
        case VLIB_ERR_BAD_PARAMETER:
            return "Invalid parameter";
        case VLIB_ERR_OUT_OF_MEMORY:
            return "Out of memory";
        case VLIB_ERR_FILE_NOT_FOUND:
            return "No such file";
        case VLIB_ERR_ACCESS:
            return "Permission denied";
        case VLIB_ERR_IO:
            return "Input/output error";
        case VLIB_ERR_BUFFER_TOO_SMALL:
            return "Buffer too small";
        case VLIB_ERR_RESOLVE:
            return "Name resolution failed";
        case VLIB_ERR_SEMAPHORE:
            return "Semaphore operation failed";
        case VLIB_ERR_NOT_FOUND:
            return "No such section, key or share";
        case VLIB_ERR_BAD_FORMAT:
            return "Malformed file content";
        case VLIB_ERR_NAME_TAKEN:
            return "Another share's name differs from it only in letter case or blanks";
        case VLIB_ERR_TOO_LARGE:
            return "The file would grow past the size its readers accept";
        case VLIB_ERR_SERVICE_ALREADY:
            return "Service already in the wanted state";
        case VLIB_ERR_SERVICE_UNKNOWN:
            return "No such service";
        case VLIB_ERR_SERVICE_FAILED:
            return "Service control failed";
        default:
            return "Unknown error";
    }
}

}  // extern "C"
