#include "daemon/shm.h"

#include <sys/ipc.h>
#include <sys/shm.h>

#include "platform/tarn_log.h"

static const char kLogUnit[] = "shm";

void *ShmCreateAttach(int key, int size, int create)
{
    int flags = create ? (IPC_CREAT | 0666) : 0666;
    int id = shmget(key, static_cast<size_t>(size), flags);
    if (id < 0) {
        TarnLog("%s:%d Failed to create shared memory. key[%d], size[%d], [%m]", kLogUnit, 35,
                key, size);
        return nullptr;
    }
    void *address = shmat(id, nullptr, 0);
    if (address == reinterpret_cast<void *>(-1)) {
        TarnLog("%s:%d Failed to attach shared memory. [%m]", kLogUnit, 41);
        return nullptr;
    }
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
