#include "daemon/access.h"

#include <grp.h>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"

static const char kLogUnit[] = "tarnaudiod";

gid_t AccessGroup()
{
    char name[256] = "audio";
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "audio_group", name, sizeof(name), 0) <= 0)
        snprintf(name, sizeof(name), "%s", "audio");
    struct group *g = getgrnam(name);
    if (!g) {
        TLOG("No group [%s] (audio_group): the control socket keeps the daemon's group", name);
        return static_cast<gid_t>(-1);
    }
    return g->gr_gid;
}

int AccessShareSocket(const char *path, gid_t group)
{
    int rc = 0;
    if (group != static_cast<gid_t>(-1) && chown(path, static_cast<uid_t>(-1), group) != 0) {
        TLOG("Failed to give %s to group %d, %m", path, static_cast<int>(group));
        rc = -1;
    }
    if (chmod(path, ACCESS_SOCKET_MODE) != 0) {
        TLOG("Failed to set the mode of %s, %m", path);
        rc = -1;
    }
    return rc;
}

int AccessShareSegment(const void *address, int key, gid_t group)
{
    int id = shmget(key, 0, 0);
    struct shmid_ds ds;
    if (!address || id < 0 || shmctl(id, IPC_STAT, &ds) != 0) {
        TLOG("Failed to read the shared memory segment %d, %m", key);
        return -1;
    }
    if (group != static_cast<gid_t>(-1))
        ds.shm_perm.gid = group;
    ds.shm_perm.mode = static_cast<unsigned short>((ds.shm_perm.mode & ~0777) | ACCESS_SEGMENT_MODE);
    if (shmctl(id, IPC_SET, &ds) != 0) {
        TLOG("Failed to set the owner of the shared memory segment %d, %m", key);
        return -1;
    }
    return 0;
}
