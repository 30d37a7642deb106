// Process-test harness: runs the real binaries in a private temporary root.
//
// Typical use in a gtest:
//
//   tarntest::Harness h;                 // fresh root, env set, segments gone
//   ASSERT_EQ(0, h.Start()) << h.Error(); // tarnaudiod running, socket ready
//   std::string reply;
//   ASSERT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply));
//   EXPECT_EQ(0, h.Stop());              // SIGTERM, waits, returns exit status
//
// The root. Each test process owns one temporary directory (mkdtemp under
// /tmp) used as TARN_ROOT; every Harness constructed in the process empties
// it and lays out the standard folders again (tmp, var/run, etc,
// usr/tarn/bin, usr/tarn/etc/audio, usr/tarn/etc.defaults/audio). The
// environment of this process is set once, so the daemon's own client code
// linked into the test (CtrlSendRequest, TarnPath, ...) addresses the same
// root, and every program the harness starts inherits it:
//   TARN_ROOT      the root
//   TARN_SHM_KEY   a key derived from this process's pid (published = +1)
//   TARN_LOG_FILE  <root>/log.txt
//   TARN_AUDIO_OUT "null" unless already set
// Only one Harness may exist at a time in a process.
//
// mplayer-daemon: when <bin>/mplayer-daemon exists it is copied to
// <root>/usr/tarn/bin/mplayer-daemon (a copy, so that its executable lies
// under the root and TLIBCKill's root scoping finds it).
//
// Processes. The test process becomes a child subreaper, so the daemonized
// tarnaudiod and everything it starts are re-parented to it; the harness
// reaps them and keeps their exit statuses. SIGPIPE is ignored in the test
// process (writes to a connection the daemon closed fail with EPIPE). Nothing is started unless the
// process runs in a private network namespace (scripts/netns-run; ctest runs
// every test that way): the daemon sends SSDP searches at start.
#ifndef TARN_TEST_HARNESS_H
#define TARN_TEST_HARNESS_H

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

#include "daemon/tarn_types.h"

namespace tarntest {

// True when this process runs in a network namespace other than the
// machine's own (compares /proc/self/ns/net with /proc/1/ns/net; when the
// latter cannot be read, trusts TARN_IN_NETNS=1 set by scripts/netns-run).
bool InPrivateNetns();

// <build>/bin/<name>.
std::string BinPath(const char *name);

// <source>/<relative>.
std::string SourcePath(const char *relative);

// A song record for a file path: path, title (file name without directory
// and extension unless given), artist, duration in seconds.
TARN_MEDIA_INFO MakeMediaInfo(const std::string &path, const std::string &title = "",
                              const std::string &artist = "", float duration = 0.0f);

// A ControlRequest with the action and, when param is not null, the text
// copied (NUL-terminated) into the parameter area; the rest is zero.
ControlRequest MakeRequest(int action, const char *param = nullptr);

// Number of open descriptors of a process (entries of /proc/<pid>/fd), -1
// when it cannot be read.
int CountFds(pid_t pid);

class Harness {
public:
    // freshSegments: remove both status segments of this process's keys so
    // that the daemon creates them anew.
    explicit Harness(bool freshSegments = true);
    // Stops the daemon if it runs, ends what it left behind under the root
    // (mplayer-daemon), reaps, detaches segments and removes them.
    ~Harness();
    Harness(const Harness &) = delete;
    Harness &operator=(const Harness &) = delete;

    // ---- files of the root --------------------------------------------
    const std::string &Root() const { return root; }
    // The path a fixed path maps to: Path("/tmp/x") == Root() + "/tmp/x".
    std::string Path(const char *fixedPath) const;
    // Writes a file under the root (folders created); 0 or -1.
    int WriteFile(const char *fixedPath, const std::string &content) const;
    // Contents of a file under the root; "" when missing.
    std::string ReadFile(const char *fixedPath) const;
    bool Exists(const char *fixedPath) const;

    // ---- tarnaudiod -----------------------------------------------------
    // Starts tarnaudiod and waits until its pid file names a living process
    // and it answers a status request (ACT_GET_STATUS) on its control
    // socket: the loop runs. 0 on success; -1 with Error() set.
    int Start(int timeoutMs = 15000);
    // Starts tarnaudiod and waits only for the launching (foreground)
    // process to end. Returns its exit status (-1 when it could not run);
    // its standard output is put into *out when out is given.
    int Launch(std::string *out = nullptr, int timeoutMs = 15000);
    // SIGTERM to the daemon; waits for it to end. Returns its exit status,
    // -1 when it did not end in time (it is then killed) or is not running.
    int Stop(int timeoutMs = 15000);
    // Pid of the running daemon (0 when not started by Start()).
    pid_t Pid() const { return daemonPid; }
    // Pid stored in the daemon's pid file (<= 0 when absent).
    int PidFromFile() const;
    // Waits for one of this process's (adopted) children to end. Returns its
    // exit status, -2 when it was killed by a signal, -1 on time-out.
    int WaitExit(pid_t pid, int timeoutMs);
    // Waits until this process has no children left; 0, or -1 on time-out.
    int WaitAllChildren(int timeoutMs);
    // Exit statuses (raw waitpid status) of every reaped process.
    const std::map<pid_t, int> &Reaped() const { return reaped; }
    // Reaps every child that has ended (non-blocking).
    void Reap();
    // Starts any program as a child of this process with the current
    // environment; returns its pid or -1.
    pid_t Spawn(const std::vector<std::string> &argv, bool quiet = true);
    // Runs a program to its end; returns its exit status (-1: could not run
    // or timed out) and its output (stdout and stderr) in *out.
    int Run(const std::vector<std::string> &argv, std::string *out = nullptr,
            int timeoutMs = 30000);

    // ---- control requests ----------------------------------------------
    // Sends one request (one write of 8196 bytes) and reads the reply.
    // 0 and the reply text (up to the NUL) in *reply; -1 when the connection
    // failed or closed without a reply within timeoutMs.
    int Request(int action, const char *param = nullptr, std::string *reply = nullptr,
                int timeoutMs = 3000);
    int RequestRaw(const ControlRequest &request, std::string *reply, int timeoutMs = 3000);
    // Sends arbitrary bytes (one write) and reads what comes back; the
    // received byte count goes to *received. -1 when the connection failed.
    int SendBytes(const void *bytes, size_t length, std::string *reply, int timeoutMs = 3000,
                  size_t *received = nullptr);
    // A connected descriptor to the control socket, or -1.
    int Connect() const;
    // ACT_QUEUE_ADD / ACT_QUEUE_INSERT of a record; 0 when a reply came.
    int QueueAdd(const TARN_MEDIA_INFO &info);
    int QueueInsert(const TARN_MEDIA_INFO &info, int position);

    // ---- log ---------------------------------------------------------------
    std::string Log() const;                       // TARN_LOG_FILE contents
    int CountLog(const std::string &needle) const; // occurrences
    bool WaitLog(const std::string &needle, int timeoutMs = 5000) const;
    void ClearLog() const;

    // ---- segments ------------------------------------------------------
    int PlayerKey() const;
    int PublishedKey() const;
    // Read-only attachments (null when the segment does not exist). They
    // stay attached until DetachSegments() or the destructor.
    const PlayerStatusShm *PlayerSegment();
    const PublishedStatusShm *PublishedSegment();
    // A writable attachment of the player segment (playing mplayer-daemon's
    // part in tests); null when absent.
    PlayerStatusShm *PlayerSegmentWritable();
    void DetachSegments();
    // Removes both segments (ignores missing ones).
    void RemoveSegments();
    // Creates a segment of a given size under a key (for layout tests);
    // 0 or -1.
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
