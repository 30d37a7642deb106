// Process-test harness: runs the real binaries in a private temporary root.
// Each test process owns one mkdtemp root used as TARN_ROOT (every Harness
// empties it and lays out the standard folders); the environment is set once
// (TARN_ROOT, TARN_SHM_KEY from the pid, TARN_LOG_FILE=<root>/log.txt,
// TARN_AUDIO_OUT=null unless set), so in-process client code and started
// programs share the root. The root's folders and mplayer-daemon (when built)
// come from the install rules (scripts/make-root.sh). The process becomes a
// child subreaper (the daemonized tarnaudiod is
// reaped here) and ignores SIGPIPE. Nothing is started outside a private
// network namespace (scripts/netns-run). Only one Harness at a time.
// The calls that speak to the control socket (Start, the requests, Connect,
// QueueAdd/QueueInsert) are in harness_ctrl.cpp and come with the
// tarn_testharness library; the rest needs only tarn_testroot.
#ifndef TARN_TEST_HARNESS_H
#define TARN_TEST_HARNESS_H

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"

namespace tarntest {

// True outside the machine's own network namespace (or TARN_IN_NETNS=1).
bool InPrivateNetns();
// The resident memory of a process in KiB (VmRSS of /proc), or -1.
long ResidentKiB(pid_t pid);
inline std::string BinPath(const char *name) { return std::string(TARN_BIN_DIR) + "/" + name; }
inline std::string SourcePath(const char *rel) { return std::string(TARN_SOURCE_DIR) + "/" + rel; }
// A song record; the title defaults to the file name without extension.
TARN_MEDIA_INFO MakeMediaInfo(const std::string &path, const std::string &title = "",
                              const std::string &artist = "", float duration = 0.0f);
// A zeroed ControlRequest with the action and the text (NUL-terminated).
ControlRequest MakeRequest(int action, const char *param = nullptr);
int CountFds(pid_t pid); // open descriptors of a process, -1 when unreadable

class Harness {
public:
    // freshSegments: remove both status segments first. The destructor stops
    // the daemon, ends mplayer-daemon under the root, reaps and removes segments.
    explicit Harness(bool freshSegments = true);
    ~Harness();
    Harness(const Harness &) = delete;
    Harness &operator=(const Harness &) = delete;

    const std::string &Root() const { return root; }
    std::string Path(const char *fixedPath) const { return root + fixedPath; }
    int WriteFile(const char *fixedPath, const std::string &content) const;
    std::string ReadFile(const char *fixedPath) const;
    bool Exists(const char *fixedPath) const;

    // Starts tarnaudiod; 0 once its pid file names a live process that answers
    // ACT_GET_STATUS, else -1 with Error() set.
    int Start(int timeoutMs = 15000);
    // Runs tarnaudiod until the launching process ends: its exit status, output.
    int Launch(std::string *out = nullptr, int timeoutMs = 15000)
    {
        return Run({BinPath("tarnaudiod")}, out, timeoutMs);
    }
    // SIGTERM, then its exit status; -1 when it had to be killed or never ran.
    int Stop(int timeoutMs = 15000);
    pid_t Pid() const { return daemonPid; }
    int PidFromFile() const;
    // Exit status of a child, -2 when killed by a signal, -1 on time-out.
    int WaitExit(pid_t pid, int timeoutMs);
    int WaitAllChildren(int timeoutMs); // 0 when no child is left
    const std::map<pid_t, int> &Reaped() const { return reaped; } // raw statuses
    void Reap();
    pid_t Spawn(const std::vector<std::string> &argv, bool quiet = true);
    // Runs a program to its end: exit status (-1 could not run or timed out),
    // stdout and stderr in *out.
    int Run(const std::vector<std::string> &argv, std::string *out = nullptr,
            int timeoutMs = 30000);

    // One write of 8196 bytes; 0 and the reply text up to its NUL, -1 when no
    // reply came. SendBytes writes any bytes and counts what came back.
    int Request(int action, const char *param = nullptr, std::string *reply = nullptr,
                int timeoutMs = 3000)
    {
        return RequestRaw(MakeRequest(action, param), reply, timeoutMs);
    }
    int RequestRaw(const ControlRequest &request, std::string *reply, int timeoutMs = 3000)
    {
        return SendBytes(&request, sizeof(request), reply, timeoutMs);
    }
    int SendBytes(const void *bytes, size_t length, std::string *reply, int timeoutMs = 3000,
                  size_t *received = nullptr);
    int Connect() const;
    int QueueAdd(const TARN_MEDIA_INFO &info) { return QueueInsert(info, -1); }
    int QueueInsert(const TARN_MEDIA_INFO &info, int position); // position < 0: add

    std::string Log() const;                       // TARN_LOG_FILE contents
    int CountLog(const std::string &needle) const; // occurrences
    bool WaitLog(const std::string &needle, int timeoutMs = 5000) const;
    void ClearLog() const;

    int PlayerKey() const { return TarnShmKeyPlayer(); }
    int PublishedKey() const { return TarnShmKeyPublished(); }
    // Attachments stay until DetachSegments() or the destructor; null if absent.
    const PlayerStatusShm *PlayerSegment();
    const PublishedStatusShm *PublishedSegment();
    PlayerStatusShm *PlayerSegmentWritable();
    void DetachSegments();
    void RemoveSegments();
    static int CreateSegment(int key, size_t size);

    const std::string &Error() const { return error; }

private:
    void PrepareRoot();
    std::string root;
    pid_t daemonPid = 0;
    std::map<pid_t, int> reaped;
    std::vector<void *> attachments;
    PlayerStatusShm *playerRo = nullptr;
    PublishedStatusShm *publishedRo = nullptr;
    PlayerStatusShm *playerRw = nullptr;
    std::string error;
};

}  // namespace tarntest

#endif
