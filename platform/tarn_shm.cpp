#include "platform/tarn_shm.h"

#include <sys/ipc.h>
#include <sys/shm.h>

void *TarnShmAttach(int key, size_t size, int flags, TarnShmStep *failed)
{
    if (failed)
        *failed = TARN_SHM_STEP_NONE;
    int id = shmget(key, size, (flags & TARN_SHM_CREATE) ? (IPC_CREAT | 0666) : 0);
    if (id < 0) {
        if (failed)
            *failed = TARN_SHM_STEP_GET;
        return nullptr;
    }
    void *address = shmat(id, nullptr, (flags & TARN_SHM_READONLY) ? SHM_RDONLY : 0);
    if (address == reinterpret_cast<void *>(-1)) {
        if (failed)
            *failed = TARN_SHM_STEP_ATTACH;
        return nullptr;
    }
    return address;
}
