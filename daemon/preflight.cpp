#include "daemon/preflight.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "platform/tlibc_proc.h"

namespace {

std::string Folder(const std::string &path)
{
    size_t slash = path.rfind('/');
    if (slash == std::string::npos)
        return ".";
    return slash == 0 ? "/" : path.substr(0, slash);
}

void CheckFolder(const std::string &path, const char *what, std::vector<std::string> *problems)
{
    std::string dir = Folder(path);
    struct stat st;
    if (stat(dir.c_str(), &st) != 0) {
        problems->push_back(std::string("folder ") + dir + " of the " + what +
                            " is missing (" + strerror(errno) + ")");
    } else if (!S_ISDIR(st.st_mode)) {
        problems->push_back(std::string(dir) + " (folder of the " + what + ") is not a folder");
    } else if (access(dir.c_str(), W_OK | X_OK) != 0) {
        problems->push_back(std::string("cannot write the ") + what + " in " + dir + " (" +
                            strerror(errno) + ")");
    }
}

// 1 when a process accepts connections on the socket at path.
int SomeoneListens(const std::string &path)
{
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return 0;
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
    int rc = connect(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr));
    close(fd);
    return rc == 0 ? 1 : 0;
}

void CheckSocket(const char *fixedPath, bool control, std::vector<std::string> *problems)
{
    std::string path = TarnPath(fixedPath);
    struct sockaddr_un addr;
    if (path.size() >= sizeof(addr.sun_path)) {
        problems->push_back("socket path " + path + " is longer than " +
                            std::to_string(sizeof(addr.sun_path) - 1) + " characters");
        return;
    }
    CheckFolder(path, "socket", problems);
    struct stat st;
    if (lstat(path.c_str(), &st) != 0)
        return;
    if (S_ISDIR(st.st_mode)) {
        problems->push_back(path + " is a folder, not a socket");
        return;
    }
    if (control && S_ISSOCK(st.st_mode) && SomeoneListens(path))
        problems->push_back("another process answers on " + path +
                            " (a daemon without its pid file " + TarnPath(TARN_PID_FILE) + "?)");
}

void CheckSegment(int key, size_t size, std::vector<std::string> *problems)
{
    if (shmget(key, 0, 0) < 0)
        return;  // created at start-up
    if (shmget(key, size, 0) < 0) {
        int err = errno;
        char name[16];
        snprintf(name, sizeof(name), "0x%x", key);
        std::string why = err == EINVAL ? "smaller than " + std::to_string(size) + " bytes"
                                        : std::string(strerror(err));
        problems->push_back(std::string("shared memory segment ") + name +
                            " exists but cannot be used (" + why + ")");
    }
}

}  // namespace

int DaemonPreflight(std::vector<std::string> *problems)
{
    std::string pidFile = TarnPath(TARN_PID_FILE);
    int pid = TLIBCReadPidFile(pidFile.c_str());
    if (pid > 0 && pid != getpid() && TLIBCProcAlive(pid))
        return 0;
    CheckFolder(pidFile, "pid file", problems);
    struct stat st;
    if (stat(pidFile.c_str(), &st) == 0 && !S_ISREG(st.st_mode))
        problems->push_back(pidFile + " is not a file");
    CheckSocket(TARN_MPLAYER_SOCKET, false, problems);
    CheckSocket(TARN_CTRL_SOCKET, true, problems);
    CheckSegment(TarnShmKeyPlayer(), TARN_SHM_PLAYER_SIZE, problems);
    CheckSegment(TarnShmKeyPublished(), TARN_SHM_PUBLISHED_SIZE, problems);
    return problems->empty() ? 0 : -1;
}

void DaemonPreflightWarnings(std::vector<std::string> *warnings)
{
    std::string player = TarnPath(TARN_MPLAYER_BIN);
    if (access(player.c_str(), X_OK) != 0)
        warnings->push_back("cannot run " + player + " (" + strerror(errno) +
                            "): local playback will fail, renderers still play");
}
