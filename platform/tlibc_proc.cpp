#include "platform/tlibc_proc.h"
#include "platform/tarn_env.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <dirent.h>
#include <fcntl.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

namespace {

// Reads a small text file; "" when it cannot be read.
std::string ReadSmallFile(const char *path, size_t max = 4096)
{
    std::string out;
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return out;
    char buf[1024];
    while (out.size() < max) {
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            break;
        out.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    return out;
}

// State letter of /proc/<pid>/stat ('R', 'S', 'Z', ...), 0 when unknown.
char ProcState(pid_t pid)
{
    char path[64];
    snprintf(path, sizeof(path), "/proc/%d/stat", static_cast<int>(pid));
    std::string stat = ReadSmallFile(path);
    // The command name is in parentheses and may itself hold blanks or ')'.
    size_t close = stat.rfind(')');
    if (close == std::string::npos || close + 2 >= stat.size())
        return 0;
    return stat[close + 2];
}

std::string BaseName(const std::string &p)
{
    size_t slash = p.rfind('/');
    return slash == std::string::npos ? p : p.substr(slash + 1);
}

bool NameMatches(pid_t pid, const char *name)
{
    char path[64];
    snprintf(path, sizeof(path), "/proc/%d/cmdline", static_cast<int>(pid));
    std::string cmdline = ReadSmallFile(path);
    std::string argv0 = cmdline.c_str();  // up to the first NUL
    if (!argv0.empty() && BaseName(argv0) == name)
        return true;
    snprintf(path, sizeof(path), "/proc/%d/comm", static_cast<int>(pid));
    std::string comm = ReadSmallFile(path);
    while (!comm.empty() && (comm.back() == '\n' || comm.back() == '\0'))
        comm.pop_back();
    // The kernel keeps at most 15 characters of the command name.
    return !comm.empty() && comm == std::string(name).substr(0, 15);
}

bool ExecutableUnderRoot(pid_t pid, const std::string &root)
{
    char path[64];
    snprintf(path, sizeof(path), "/proc/%d/exe", static_cast<int>(pid));
    char target[4096];
    ssize_t n = readlink(path, target, sizeof(target) - 1);
    if (n <= 0)
        return false;
    target[n] = '\0';
    std::string exe(target);
    std::string prefix = root + "/";
    return exe.compare(0, prefix.size(), prefix) == 0;
}

void SleepMs(int ms)
{
    struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
    while (nanosleep(&ts, &ts) == -1 && errno == EINTR) {
    }
}

// In a freshly forked child: close every descriptor from 3 up except keep.
void CloseInheritedFds(int keep)
{
    if (keep > 3)
        close_range(3, static_cast<unsigned>(keep - 1), 0);
    close_range(static_cast<unsigned>(keep < 3 ? 3 : keep + 1), ~0U, 0);
}

// In a freshly forked child: default signal dispositions and an empty mask,
// so that the program does not inherit the caller's ignored SIGPIPE.
void ResetSignals()
{
    for (int s = 1; s < NSIG; ++s)
        signal(s, SIG_DFL);
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
}

}  // namespace

int TLIBCReadPidFile(const char *path)
{
    if (!path)
        return -1;
    int fd = open(path, O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return -1;
    close(fd);
    std::string text = ReadSmallFile(path, 64);
    long pid = strtol(text.c_str(), nullptr, 10);
    if (pid <= 0 || pid > 0x7fffffffL)
        return 0;
    return static_cast<int>(pid);
}

int TLIBCProcAlive(pid_t pid)
{
    if (pid <= 0)
        return 0;
    if (kill(pid, 0) != 0 && errno != EPERM)
        return 0;
    char state = ProcState(pid);
    if (state == 'Z' || state == 'X' || state == 'x')
        return 0;
    return 1;
}

int TLIBCProcPidFileCreate(const char *path)
{
    if (!path)
        return -1;
    int fd = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0)
        return -1;
    char text[32];
    int len = snprintf(text, sizeof(text), "%d\n", static_cast<int>(getpid()));
    ssize_t w = write(fd, text, static_cast<size_t>(len));
    int rc = close(fd);
    return (w == len && rc == 0) ? 0 : -1;
}

int TLIBCProcAliveByPidFile(const char *path)
{
    int pid = TLIBCReadPidFile(path);
    return pid > 0 && TLIBCProcAlive(pid) ? 1 : 0;
}

int TLIBCProcSignalByPidFile(const char *path, int sig)
{
    int pid = TLIBCReadPidFile(path);
    if (pid <= 0 || !TLIBCProcAlive(pid))
        return -1;
    return kill(pid, sig) == 0 ? 0 : -1;
}

int TLIBCKill(const char *name, int sig)
{
    if (!name || !*name)
        return -1;
    DIR *dir = opendir("/proc");
    if (!dir)
        return -1;
    const std::string &root = TarnRoot();
    pid_t self = getpid();
    std::vector<pid_t> found;
    while (struct dirent *e = readdir(dir)) {
        char *end = nullptr;
        long pid = strtol(e->d_name, &end, 10);
        if (pid <= 0 || !end || *end != '\0' || pid == self)
            continue;
        if (!TLIBCProcAlive(static_cast<pid_t>(pid)))
            continue;
        if (!NameMatches(static_cast<pid_t>(pid), name))
            continue;
        if (!root.empty() && !ExecutableUnderRoot(static_cast<pid_t>(pid), root))
            continue;
        found.push_back(static_cast<pid_t>(pid));
    }
    closedir(dir);
    int count = 0;
    for (pid_t pid : found)
        if (kill(pid, sig > 0 ? sig : SIGTERM) == 0)
            ++count;
    if (sig == 0) {
        // Give them half a second to end cleanly, then make sure.
        for (int waited = 0; waited < 500; waited += 10) {
            bool any = false;
            for (pid_t pid : found)
                any = any || TLIBCProcAlive(pid);
            if (!any)
                break;
            SleepMs(10);
        }
        for (pid_t pid : found)
            if (TLIBCProcAlive(pid))
                kill(pid, SIGKILL);
    }
    return count;
}

int TLIBCExecv(const char *path, char *const argv[], int noWait)
{
    if (!path || !argv || !argv[0])
        return -1;
    if (!noWait) {
        pid_t child = fork();
        if (child < 0)
            return -1;
        if (child == 0) {
            CloseInheritedFds(-1);
            ResetSignals();
            execv(path, argv);
            _exit(127);
        }
        int status = 0;
        while (waitpid(child, &status, 0) < 0) {
            if (errno != EINTR)
                return -1;
        }
        if (!WIFEXITED(status))
            return -1;
        return WEXITSTATUS(status) == 127 ? -1 : WEXITSTATUS(status);
    }

    // Detached start: the intermediate child forks the program and exits at
    // once, so the program is adopted by init (or the nearest subreaper).
    // A close-on-exec pipe tells whether the exec itself succeeded.
    int pipefd[2];
    if (pipe2(pipefd, O_CLOEXEC) != 0)
        return -1;
    pid_t child = fork();
    if (child < 0) {
        close(pipefd[0]);
        close(pipefd[1]);
        return -1;
    }
    if (child == 0) {
        close(pipefd[0]);
        pid_t grandchild = fork();
        if (grandchild < 0) {
            int err = errno;
            ssize_t w = write(pipefd[1], &err, sizeof(err));
            (void)w;
            _exit(1);
        }
        if (grandchild > 0)
            _exit(0);
        setsid();
        CloseInheritedFds(pipefd[1]);
        ResetSignals();
        execv(path, argv);
        int err = errno;
        ssize_t w = write(pipefd[1], &err, sizeof(err));
        (void)w;
        _exit(127);
    }
    close(pipefd[1]);
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    int err = 0;
    ssize_t n;
    while ((n = read(pipefd[0], &err, sizeof(err))) < 0 && errno == EINTR) {
    }
    close(pipefd[0]);
    if (n > 0)
        return -1;  // fork or exec failed
    return 0;
}
