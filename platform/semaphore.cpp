// Cross-process binary semaphores over System V semaphore sets, one per integer key.
#include <errno.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <time.h>

#include <cstring>
#include <new>

#include "platform/platform_internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

using S2S::Logger;
using s2s_platform::Fail;
using s2s_platform::Succeed;

struct VLIBSem {
    int key;
    int id;
    bool held;
};

namespace {

int SemFailure(int line, const char* what, int key) {
    int saved = errno;
    Logger::LogMsg(Logger::Error,
                   "[ERROR] semaphore.cpp(%d): Fail to %s semaphore 0x%X, error:'%s'\n", line, what,
                   static_cast<unsigned>(key), std::strerror(saved));
    return Fail(saved == EACCES ? VLIB_ERR_ACCESS : VLIB_ERR_SEMAPHORE);
}

// A new set starts at 0 and its creator raises it to 1. Raising it with semop also stamps
// sem_otime, which is how an opener that did not create the set knows it is ready to use.
int OpenSet(int key) {
    for (int attempt = 0; attempt < 100; ++attempt) {
        int id = semget(key, 1, IPC_CREAT | IPC_EXCL | 0600);
        if (id >= 0) {
            struct sembuf up = {0, 1, 0};
            if (semop(id, &up, 1) != 0) {
                int saved = errno;
                semctl(id, 0, IPC_RMID);
                errno = saved;
                return -1;
            }
            return id;
        }
        if (errno != EEXIST) {
            return -1;
        }
        id = semget(key, 1, 0);
        if (id < 0) {
            if (errno == ENOENT) {
                continue;  // removed between the two calls
            }
            return -1;
        }
        // Its creator initialises it within microseconds; wait up to two seconds for that.
        for (int wait = 0; wait < 2000; ++wait) {
            struct semid_ds info;
            union semun {
                int val;
                struct semid_ds* buf;
            } arg;
            arg.buf = &info;
            if (semctl(id, 0, IPC_STAT, arg) != 0) {
                if (errno == EINVAL || errno == EIDRM) {
                    break;  // removed meanwhile: start over
                }
                return -1;
            }
            if (info.sem_otime != 0) {
                return id;
            }
            struct timespec pause = {0, 1000000};
            nanosleep(&pause, nullptr);
            if (wait == 1999) {
                // The creator died before raising it: nobody can ever take it. Raising it here
                // could race another opener into a count of 2, so leave it to an administrator.
                errno = ETIMEDOUT;
                return -1;
            }
        }
    }
    errno = EAGAIN;
    return -1;
}

}  // namespace

extern "C" {

VLIBSem* VLIBCSemOpen(int key) {
    if (key == IPC_PRIVATE) {
        s2s_platform::SetError(VLIB_ERR_BAD_PARAMETER);
        return nullptr;
    }
    int id = OpenSet(key);
    if (id < 0) {
        SemFailure(__LINE__, "open", key);
        return nullptr;
    }
    // The handle crosses the C interface as an opaque pointer; VLIBCSemClose deletes it.
    VLIBSem* sem = new (std::nothrow) VLIBSem{key, id, false};
    if (sem == nullptr) {
        s2s_platform::SetError(VLIB_ERR_OUT_OF_MEMORY);
        return nullptr;
    }
    s2s_platform::SetError(VLIB_ERR_NONE);
    return sem;
}

int VLIBCSemLock(VLIBSem* sem) {
    if (sem == nullptr || sem->held) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    // SEM_UNDO: the kernel gives the semaphore back when this process dies holding it.
    struct sembuf down = {0, -1, SEM_UNDO};
    while (semop(sem->id, &down, 1) != 0) {
        if (errno != EINTR) {
            return SemFailure(__LINE__, "lock", sem->key);
        }
    }
    sem->held = true;
    return Succeed(0);
}

int VLIBCSemUnlock(VLIBSem* sem) {
    if (sem == nullptr || !sem->held) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    struct sembuf up = {0, 1, SEM_UNDO};
    while (semop(sem->id, &up, 1) != 0) {
        if (errno != EINTR) {
            return SemFailure(__LINE__, "unlock", sem->key);
        }
    }
    sem->held = false;
    return Succeed(0);
}

int VLIBCSemClose(VLIBSem* sem) {
    if (sem == nullptr) {
        return 0;
    }
    if (sem->held) {
        VLIBCSemUnlock(sem);
    }
    delete sem;
    return 0;
}

int VLIBCSemRemove(int key) {
    if (key == IPC_PRIVATE) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    int id = semget(key, 1, 0);
    if (id < 0) {
        return errno == ENOENT ? Fail(VLIB_ERR_NOT_FOUND) : SemFailure(__LINE__, "find", key);
    }
    if (semctl(id, 0, IPC_RMID) != 0) {
        return SemFailure(__LINE__, "remove", key);
    }
    return Succeed(0);
}

}  // extern "C"
