#include "daemon/shm.h"

#include <sys/ipc.h>
#include <sys/shm.h>

#include "platform/tarn_log.h"
#include "platform/tarn_shm.h"

static const char kLogUnit[] = "shm";

void *ShmCreateAttach(int key, int size, int create)
{
    TarnShmStep failed = TARN_SHM_STEP_NONE;
    void *address =
        TarnShmAttach(key, static_cast<size_t>(size), create ? TARN_SHM_CREATE : 0, &failed);
    if (failed == TARN_SHM_STEP_GET)
        TarnLog("%s:%d Failed to create shared memory. key[%d], size[%d], [%m]", kLogUnit, 35,
                key, size);
    else if (failed == TARN_SHM_STEP_ATTACH)
        TarnLog("%s:%d Failed to attach shared memory. [%m]", kLogUnit, 41);
    return address;
}

int ShmDetach(void *address)
{
    if (shmdt(address) != 0) {
        TarnLog("%s:%d Failed to detach shared memory.", kLogUnit, 52);
        return -1;
    }
    return 0;
}

int ShmRemove(int key, int size)
{
    int id = shmget(key, static_cast<size_t>(size), 0666);
    if (id < 0) {
        TarnLog("%s:%d Get shared memory fail. Might not exist.(%m)", kLogUnit, 66);
        return -1;
    }
    int rc = shmctl(id, IPC_RMID, nullptr);
    if (rc != 0)
        TarnLog("%s:%d Failed to remove shared memory.(%m)", kLogUnit, 71);
    return rc;
}
