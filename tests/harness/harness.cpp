#include "tests/harness/harness.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/ipc.h>
#include <sys/prctl.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/fd_read.h"
#include "platform/tarn_env.h"
#include "platform/tarn_shm.h"
#include "platform/tlibc_proc.h"

namespace tarntest {

namespace {

// A function-local static: test files create a Harness during their own static
// initialisation, which may run before this file's.
std::string &ProcessRoot()
{
    static std::string root;
    return root;
}

long NowMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000L + ts.tv_nsec / 1000000L;
}

void SleepMs(int ms) { usleep(static_cast<useconds_t>(ms) * 1000); }

// Empties a directory tree (the directory itself stays).
void EmptyDir(const std::string &dir)
{
    std::error_code ec;
    for (const auto &e : std::filesystem::directory_iterator(dir, ec))
        std::filesystem::remove_all(e.path(), ec);
}

void RemoveProcessRoot()
{
    std::error_code ec;
    std::filesystem::remove_all(ProcessRoot(), ec);
}

int MakeDirs(const std::string &path)
{
    std::error_code ec;
    std::filesystem::create_directories(path, ec);
    return std::filesystem::is_directory(path, ec) ? 0 : -1;
}

std::string ReadAll(const std::string &path)
{
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

void RemoveSegment(int key) { shmctl(shmget(key, 0, 0), IPC_RMID, nullptr); }

void *AttachSegment(int key, size_t size, bool readOnly)
{
    return TarnShmAttach(key, size, readOnly ? TARN_SHM_READONLY : 0);
}

}  // namespace

long ResidentKiB(pid_t pid)
{
    FILE *f = fopen(("/proc/" + std::to_string(pid) + "/status").c_str(), "r");
    if (f == nullptr)
        return -1;
    char line[256];
    long kib = -1;
    while (kib < 0 && fgets(line, sizeof(line), f) != nullptr)
        if (sscanf(line, "VmRSS: %ld kB", &kib) != 1)
            kib = -1;
    fclose(f);
    return kib;
}

bool InPrivateNetns()
{
    std::error_code e1, e2;
    auto self = std::filesystem::read_symlink("/proc/self/ns/net", e1);
    auto init = std::filesystem::read_symlink("/proc/1/ns/net", e2);
    if (!e1 && !e2)
        return self != init;
    return TarnEnvGet("TARN_IN_NETNS") == "1";
}

TARN_MEDIA_INFO MakeMediaInfo(const std::string &path, const std::string &title,
                              const std::string &artist, float duration)
{
    TARN_MEDIA_INFO info;
    memset(&info, 0, sizeof(info));
    snprintf(info.path, sizeof(info.path), "%s", path.c_str());
    std::string t = title.empty() ? std::filesystem::path(path).stem().string() : title;
    snprintf(info.title, sizeof(info.title), "%s", t.c_str());
    snprintf(info.artist, sizeof(info.artist), "%s", artist.c_str());
    info.duration = duration;
    return info;
}

ControlRequest MakeRequest(int action, const char *param)
{
    ControlRequest req;
    memset(&req, 0, sizeof(req));
    req.action = action;
    if (param)
        snprintf(req.parameter, sizeof(req.parameter), "%s", param);
    return req;
}

int CountFds(pid_t pid)
{
    std::error_code ec;
    std::filesystem::directory_iterator it("/proc/" + std::to_string(pid) + "/fd", ec);
    return ec ? -1 : static_cast<int>(std::distance(it, {}));
}

Harness::Harness(bool freshSegments)
{
    prctl(PR_SET_CHILD_SUBREAPER, 1, 0, 0, 0);
    // A daemon that closes a connection early must fail a write, not end
    // the test program.
    signal(SIGPIPE, SIG_IGN);
    if (ProcessRoot().empty()) {
        char tmpl[] = "/tmp/tarnroot.XXXXXX";
        if (!mkdtemp(tmpl)) {
            error = std::string("mkdtemp failed: ") + strerror(errno);
            return;
        }
        ProcessRoot() = tmpl;
        atexit(RemoveProcessRoot);
        char key[32];
        // Distinct per test process; keys stay clear of the appliance's own.
        snprintf(key, sizeof(key), "%d", 0x30000000 + (static_cast<int>(getpid()) % 0x100000) * 4);
        setenv("TARN_ROOT", ProcessRoot().c_str(), 1);
        setenv("TARN_SHM_KEY", key, 1);
        setenv("TARN_LOG_FILE", (ProcessRoot() + "/log.txt").c_str(), 1);
        if (TarnEnvGet("TARN_AUDIO_OUT").empty())
            setenv("TARN_AUDIO_OUT", "null", 1);
    }
    root = ProcessRoot();
    if (TarnRoot() != root)
        error = "TARN_ROOT was read before the harness set it";
    PrepareRoot();
    if (freshSegments)
        RemoveSegments();
}

Harness::~Harness()
{
    if (daemonPid > 0)
        Stop();
    // Whatever the daemon started under this root (mplayer-daemon) ends too.
    TLIBCKill("mplayer-daemon", SIGKILL);
    WaitAllChildren(3000);
    DetachSegments();
    RemoveSegments();
}

void Harness::PrepareRoot()
{
    if (root.empty())
        return;
    EmptyDir(root);
    // The folders and mplayer-daemon, laid out by the install rules like
    // every other root (scripts/make-root.sh); the profiles, radio seeds and
    // configuration are left to each test.
    std::vector<std::string> argv = {SourcePath("scripts/make-root.sh"), "--build", TARN_BUILD_DIR};
    if (access(BinPath("mplayer-daemon").c_str(), X_OK) == 0) {
        argv.push_back("--component");
        argv.push_back("player");
    } else {
        argv.push_back("--component");
        argv.push_back("none");
    }
    argv.push_back(root);
    std::vector<char *> args;
    for (std::string &a : argv)
        args.push_back(&a[0]);
    args.push_back(nullptr);
    pid_t pid = -1;
    int status = -1;
    if (posix_spawn(&pid, args[0], nullptr, nullptr, args.data(), environ) != 0 ||
        waitpid(pid, &status, 0) != pid || !WIFEXITED(status) || WEXITSTATUS(status) != 0)
        error = "scripts/make-root.sh failed for " + root;
}

int Harness::WriteFile(const char *fixedPath, const std::string &content) const
{
    std::string p = Path(fixedPath);
    if (MakeDirs(p.substr(0, p.rfind('/'))) != 0)
        return -1;
    std::ofstream out(p, std::ios::binary | std::ios::trunc);
    out << content;
    out.close();
    return out ? 0 : -1;
}

std::string Harness::ReadFile(const char *fixedPath) const { return ReadAll(Path(fixedPath)); }

bool Harness::Exists(const char *fixedPath) const
{
    std::error_code ec;
    return std::filesystem::exists(std::filesystem::symlink_status(Path(fixedPath), ec));
}

// ---- processes -------------------------------------------------------------

void Harness::Reap()
{
    int status = 0;
    for (pid_t p; (p = waitpid(-1, &status, WNOHANG)) > 0;)
        reaped[p] = status;
}

int Harness::WaitExit(pid_t pid, int timeoutMs)
{
    long end = NowMs() + timeoutMs;
    for (;;) {
        Reap();
        auto it = reaped.find(pid);
        if (it != reaped.end())
            return WIFEXITED(it->second) ? WEXITSTATUS(it->second) : -2;
        if (NowMs() >= end)
            return -1;
        SleepMs(5);
    }
}

int Harness::WaitAllChildren(int timeoutMs)
{
    long end = NowMs() + timeoutMs;
    for (;;) {
        int status = 0;
        pid_t p = waitpid(-1, &status, WNOHANG);
        if (p > 0)
            reaped[p] = status;
        else if (p < 0 && errno == ECHILD)
            return 0;
        else if (NowMs() >= end)
            return -1;
        else
            SleepMs(5);
    }
}

// Forks and execs argv with stdout and stderr on outFd (-1: /dev/null, -2: kept).
static pid_t ForkExec(const std::vector<std::string> &argv, int outFd)
{
    std::vector<char *> args;
    for (const std::string &a : argv)
        args.push_back(const_cast<char *>(a.c_str()));
    args.push_back(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        int fd = outFd == -1 ? open("/dev/null", O_RDWR) : outFd;
        if (fd >= 0) {
            dup2(fd, 1);
            dup2(fd, 2);
        }
        execv(args[0], args.data());
        _exit(127);
    }
    return pid;
}

pid_t Harness::Spawn(const std::vector<std::string> &argv, bool quiet)
{
    if (!InPrivateNetns()) {
        error = "refusing to start programs outside a private network namespace "
                "(run under scripts/netns-run)";
        return -1;
    }
    return argv.empty() ? -1 : ForkExec(argv, quiet ? -1 : -2);
}

int Harness::Run(const std::vector<std::string> &argv, std::string *out, int timeoutMs)
{
    int fds[2];
    if (argv.empty() || pipe2(fds, O_CLOEXEC) != 0)
        return -1;
    pid_t pid = InPrivateNetns() ? ForkExec(argv, fds[1]) : -1;
    close(fds[1]);
    if (pid < 0) {
        close(fds[0]);
        if (error.empty())
            error = "refusing to start programs outside a private network namespace";
        return -1;
    }
    long end = NowMs() + timeoutMs;
    // Until every holder of the pipe closed it (a daemonizing child lets go).
    std::string text;
    TarnReadUntilClosed(fds[0], timeoutMs, &text);
    close(fds[0]);
    if (out)
        *out = text;
    int rc = WaitExit(pid, static_cast<int>(end - NowMs() > 0 ? end - NowMs() : 0));
    if (rc == -1) {
        kill(pid, SIGKILL);
        WaitExit(pid, 2000);
        error = "program did not end in time: " + argv[0];
        return -1;
    }
    return rc == -2 ? -1 : rc;
}

int Harness::PidFromFile() const { return TLIBCReadPidFile(Path(TARN_PID_FILE).c_str()); }

int Harness::Stop(int timeoutMs)
{
    if (daemonPid <= 0)
        return -1;
    pid_t pid = daemonPid;
    daemonPid = 0;
    if (kill(pid, SIGTERM) != 0)
        return WaitExit(pid, 1000);
    int rc = WaitExit(pid, timeoutMs);
    if (rc == -1) {
        error = "tarnaudiod did not end after SIGTERM; killed";
        kill(pid, SIGKILL);
        WaitExit(pid, 2000);
        return -1;
    }
    return rc;
}

// ---- log ---------------------------------------------------------------------

std::string Harness::Log() const { return ReadAll(root + "/log.txt"); }

int Harness::CountLog(const std::string &needle) const
{
    std::string log = Log();
    int n = 0;
    for (size_t pos = log.find(needle); pos != std::string::npos; pos = log.find(needle, pos + 1))
        ++n;
    return n;
}

bool Harness::WaitLog(const std::string &needle, int timeoutMs) const
{
    for (long end = NowMs() + timeoutMs; CountLog(needle) == 0; SleepMs(10))
        if (NowMs() >= end)
            return false;
    return true;
}

void Harness::ClearLog() const { truncate((root + "/log.txt").c_str(), 0); }

// ---- segments ----------------------------------------------------------------

template <typename T> static T *Attach(T *&slot, int key, size_t size, bool ro, std::vector<void *> &all)
{
    if (!slot && (slot = static_cast<T *>(AttachSegment(key, size, ro))))
        all.push_back(slot);
    return slot;
}

const PlayerStatusShm *Harness::PlayerSegment()
{
    return Attach(playerRo, PlayerKey(), TARN_SHM_PLAYER_SIZE, true, attachments);
}

const PublishedStatusShm *Harness::PublishedSegment()
{
    return Attach(publishedRo, PublishedKey(), TARN_SHM_PUBLISHED_SIZE, true, attachments);
}

PlayerStatusShm *Harness::PlayerSegmentWritable()
{
    return Attach(playerRw, PlayerKey(), TARN_SHM_PLAYER_SIZE, false, attachments);
}

void Harness::DetachSegments()
{
    for (void *p : attachments)
        shmdt(p);
    attachments.clear();
    playerRo = nullptr;
    publishedRo = nullptr;
    playerRw = nullptr;
}

void Harness::RemoveSegments()
{
    RemoveSegment(PlayerKey());
    RemoveSegment(PublishedKey());
}

int Harness::CreateSegment(int key, size_t size)
{
    return shmget(key, size, IPC_CREAT | IPC_EXCL | 0666) >= 0 ? 0 : -1;
}

}  // namespace tarntest
