// Helpers of the mplayer-daemon process tests: a temporary root, the
// daemon's side of the command socket and of the player status segment,
// the real mplayer-daemon binary started with a WAV output, test tones made
// with sox/lame, and analysis of the WAV file it writes.
#ifndef MPLAYER_PROCESS_UTIL_H
#define MPLAYER_PROCESS_UTIL_H

#include "daemon/tarn_types.h"
#include "tools/mplayer-daemon/command_parser.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <string>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

extern char **environ;

namespace mptest {

inline bool WaitFor(const std::function<bool()> &cond, int timeoutMs)
{
    auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    for (;;) {
        if (cond())
            return true;
        if (std::chrono::steady_clock::now() >= end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
}

inline void SleepMs(int ms)
{
    std::this_thread::sleep_for(std::chrono::milliseconds(ms));
}

// Runs a tool to completion; returns its exit status or -1.
inline int RunTool(const std::vector<std::string> &argv)
{
    std::vector<char *> a;
    for (const std::string &s : argv)
        a.push_back(const_cast<char *>(s.c_str()));
    a.push_back(nullptr);
    posix_spawn_file_actions_t fa;
    posix_spawn_file_actions_init(&fa);
    posix_spawn_file_actions_addopen(&fa, 1, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addopen(&fa, 2, "/dev/null", O_WRONLY, 0);
    pid_t pid = 0;
    int rc = posix_spawnp(&pid, a[0], &fa, nullptr, a.data(), environ);
    posix_spawn_file_actions_destroy(&fa);
    if (rc != 0)
        return -1;
    int status = 0;
    if (waitpid(pid, &status, 0) != pid || !WIFEXITED(status))
        return -1;
    return WEXITSTATUS(status);
}

// A fresh directory used as TARN_ROOT, removed at the end.
struct TempRoot {
    std::string dir;
    TempRoot()
    {
        char tmpl[] = "/tmp/mplayer-test-XXXXXX";
        const char *d = mkdtemp(tmpl);
        dir = d ? d : "";
        std::filesystem::create_directories(dir + "/tmp");
        std::filesystem::create_directories(dir + "/var/run");
        std::filesystem::create_directories(dir + "/media");
    }
    ~TempRoot()
    {
        std::error_code ec;
        if (!dir.empty() && !getenv("MPLAYER_TEST_KEEP"))
            std::filesystem::remove_all(dir, ec);
    }
    std::string Path(const std::string &rel) const { return dir + rel; }
};

// A tone file: "sine" of freq Hz for the given seconds at half scale; the
// format follows the extension (mp3 through lame, m4a through GStreamer).
inline bool MakeTone(const std::string &path, double freq, double seconds, int rate = 44100,
                     int channels = 2)
{
    std::string ext = path.substr(path.rfind('.') + 1);
    std::string f = std::to_string(freq);
    std::string d = std::to_string(seconds);
    if (ext == "mp3") {
        std::string wav = path + ".src.wav";
        if (RunTool({"sox", "-n", "-r", std::to_string(rate), "-c", std::to_string(channels),
                     "-b", "16", wav, "synth", d, "sine", f, "vol", "0.5"}) != 0)
            return false;
        int rc = RunTool({"lame", "--quiet", "-b", "128", "-t", wav, path});
        unlink(wav.c_str());
        return rc == 0;
    }
    if (ext == "m4a") {
        int buffers = static_cast<int>(seconds * rate / 1024);
        return RunTool({"gst-launch-1.0", "-q", "audiotestsrc", "num-buffers=" + std::to_string(buffers),
                        "samplesperbuffer=1024", "freq=" + f, "volume=0.5", "!",
                        "audio/x-raw,rate=" + std::to_string(rate), "!", "audioconvert", "!",
                        "avenc_aac", "!", "mp4mux", "!", "filesink", "location=" + path}) == 0;
    }
    return RunTool({"sox", "-n", "-r", std::to_string(rate), "-c", std::to_string(channels), "-b",
                    "16", path, "synth", d, "sine", f, "vol", "0.5"}) == 0;
}

// Concatenates audio files with sox (same rate and channels).
inline bool Concat(const std::vector<std::string> &parts, const std::string &out)
{
    std::vector<std::string> a = {"sox"};
    a.insert(a.end(), parts.begin(), parts.end());
    a.push_back(out);
    return RunTool(a) == 0;
}

// The daemon's end of "/tmp/mplayer.sock".
class CommandSocket {
public:
    ~CommandSocket()
    {
        CloseClient();
        if (listenFd_ >= 0)
            close(listenFd_);
        if (!path_.empty())
            unlink(path_.c_str());
    }
    bool Listen(const std::string &path)
    {
        path_ = path;
        unlink(path.c_str());
        listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr;
        memset(&addr, 0, sizeof(addr));
        addr.sun_family = AF_UNIX;
        snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", path.c_str());
        return listenFd_ >= 0 &&
               bind(listenFd_, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) == 0 &&
               listen(listenFd_, 1) == 0;
    }
    bool Accept(int timeoutMs)
    {
        struct pollfd p = {listenFd_, POLLIN, 0};
        if (poll(&p, 1, timeoutMs) != 1)
            return false;
        fd_ = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
        return fd_ >= 0;
    }
    bool SendBytes(const std::string &bytes)
    {
        return fd_ >= 0 && write(fd_, bytes.data(), bytes.size()) ==
                               static_cast<ssize_t>(bytes.size());
    }
    // The two framings the daemon uses.
    bool Raw(const std::string &text) { return SendBytes(text); }
    bool Padded(const std::string &text)
    {
        std::string b(2048, '\0');
        b.replace(0, text.size(), text);
        return SendBytes(b);
    }
    bool Load(const std::string &uri)
    {
        return SendBytes("loadfile \"" + MplayerEscapeUri(uri) + "\"");
    }
    void CloseClient()
    {
        if (fd_ >= 0)
            close(fd_);
        fd_ = -1;
    }

private:
    std::string path_;
    int listenFd_ = -1;
    int fd_ = -1;
};

// The daemon's view of the player status segment.
class PlayerSegment {
public:
    ~PlayerSegment()
    {
        if (shm_)
            shmdt(const_cast<PlayerStatusShm *>(shm_));
        if (id_ >= 0)
            shmctl(id_, IPC_RMID, nullptr);
    }
    bool Create(int key)
    {
        id_ = shmget(key, sizeof(PlayerStatusShm), IPC_CREAT | 0666);
        if (id_ < 0)
            return false;
        void *p = shmat(id_, nullptr, 0);
        if (p == reinterpret_cast<void *>(-1))
            return false;
        shm_ = static_cast<volatile PlayerStatusShm *>(p);
        memset(p, 0, sizeof(PlayerStatusShm));
        return true;
    }
    int State() const { return shm_->state; }
    void SetState(int s) { shm_->state = s; }
    int Duration() const { return shm_->duration; }
    int Position() const { return shm_->position; }
    std::string Uri() const { return Text(shm_->currentUri, sizeof(shm_->currentUri)); }
    std::string Station() const { return Text(shm_->radioStation, sizeof(shm_->radioStation)); }
    std::string Title() const { return Text(shm_->streamTitle, sizeof(shm_->streamTitle)); }
    int Volume() const { return shm_->value4104; }

private:
    static std::string Text(const volatile char *p, size_t n)
    {
        std::string s;
        for (size_t i = 0; i < n && p[i]; ++i)
            s += p[i];
        return s;
    }
    int id_ = -1;
    volatile PlayerStatusShm *shm_ = nullptr;
};

// A segment key no other test process uses.
inline int UniqueShmKey(int salt)
{
    return 0x4D500000 + ((static_cast<int>(getpid()) & 0x3FFF) << 4) + (salt & 0xF);
}

// The real binary, started the way the daemon starts it.
class PlayerProcess {
public:
    ~PlayerProcess()
    {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
    }
    bool Start(const TempRoot &root, int shmKey, const std::string &audioOut,
               const std::string &uri, int volume = 100,
               const std::string &eq = "0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0:0.0")
    {
        std::string bin = std::string(TARN_BIN_DIR) + "/mplayer-daemon";
        std::vector<std::string> args = {bin};
        if (!uri.empty())
            args.push_back(uri);
        std::vector<std::string> rest = {"-loop", "0", "-daemon", "-volume", std::to_string(volume),
                                         "-af", "equalizer=" + eq};
        args.insert(args.end(), rest.begin(), rest.end());
        std::vector<std::string> env;
        for (char **e = environ; *e; ++e) {
            std::string v(*e);
            // The test's servers are on loopback: no proxy may get in between.
            if (v.compare(0, 5, "TARN_") == 0 || v.find("_proxy=") != std::string::npos ||
                v.find("_PROXY=") != std::string::npos)
                continue;
            bool drop = false;
            for (const std::string &u : unsetVars)
                drop = drop || v.compare(0, u.size() + 1, u + "=") == 0;
            if (drop)
                continue;
            env.push_back(v);
        }
        env.push_back("TARN_ROOT=" + root.dir);
        env.push_back("TARN_SHM_KEY=" + std::to_string(shmKey));
        env.push_back("TARN_AUDIO_OUT=" + audioOut);
        env.push_back("TARN_LOG_FILE=" + root.Path("/log.txt"));
        std::vector<char *> a, e;
        for (std::string &s : args)
            a.push_back(&s[0]);
        a.push_back(nullptr);
        for (std::string &s : env)
            e.push_back(&s[0]);
        e.push_back(nullptr);
        return posix_spawn(&pid_, bin.c_str(), nullptr, nullptr, a.data(), e.data()) == 0;
    }
    pid_t Pid() const { return pid_; }
    // Variables of the test's environment that the player does not get.
    std::vector<std::string> unsetVars;
    bool Alive()
    {
        if (pid_ <= 0)
            return false;
        int status = 0;
        pid_t r = waitpid(pid_, &status, WNOHANG);
        if (r == pid_) {
            status_ = status;
            pid_ = -1;
            return false;
        }
        return true;
    }
    // Waits for the exit; returns the exit status, or -1 (killed after the
    // timeout, or ended by a signal).
    int WaitExit(int timeoutMs)
    {
        if (!WaitFor([this] { return !Alive(); }, timeoutMs)) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
            pid_ = -1;
            return -1;
        }
        return WIFEXITED(status_) ? WEXITSTATUS(status_) : -1;
    }
    void Signal(int sig)
    {
        if (pid_ > 0)
            kill(pid_, sig);
    }

private:
    pid_t pid_ = -1;
    int status_ = 0;
};

// A WAV file as mplayer-daemon writes it (16-bit PCM).
struct Wav {
    bool ok = false;
    std::string why;
    int rate = 0;
    int channels = 0;
    std::vector<int16_t> samples;  // interleaved

    double Seconds() const
    {
        return ok ? static_cast<double>(samples.size()) / channels / rate : 0.0;
    }
    // Left-channel samples of [t0, t1) seconds.
    std::vector<double> Left(double t0, double t1) const
    {
        std::vector<double> v;
        if (!ok)
            return v;
        size_t frames = samples.size() / channels;
        size_t a = static_cast<size_t>(std::max(0.0, t0) * rate);
        size_t b = std::min(frames, static_cast<size_t>(std::max(0.0, t1) * rate));
        for (size_t i = a; i < b; ++i)
            v.push_back(samples[i * channels] / 32768.0);
        return v;
    }
    // Frequency from the rising zero crossings of [t0, t1).
    double Frequency(double t0, double t1) const
    {
        std::vector<double> v = Left(t0, t1);
        if (v.size() < 2)
            return 0.0;
        long first = -1, last = -1, count = 0;
        for (size_t i = 1; i < v.size(); ++i) {
            if (v[i - 1] < 0 && v[i] >= 0) {
                if (first < 0)
                    first = static_cast<long>(i);
                last = static_cast<long>(i);
                ++count;
            }
        }
        if (count < 2)
            return 0.0;
        return (count - 1) * static_cast<double>(rate) / (last - first);
    }
    double Rms(double t0, double t1) const
    {
        std::vector<double> v = Left(t0, t1);
        if (v.empty())
            return 0.0;
        double s = 0;
        for (double x : v)
            s += x * x;
        return std::sqrt(s / v.size());
    }
};

inline uint32_t Le32(const unsigned char *p)
{
    return p[0] | (p[1] << 8) | (p[2] << 16) | (static_cast<uint32_t>(p[3]) << 24);
}

inline Wav ReadWav(const std::string &path)
{
    Wav w;
    FILE *f = fopen(path.c_str(), "rb");
    if (!f) {
        w.why = "cannot open " + path;
        return w;
    }
    std::vector<unsigned char> d;
    unsigned char buf[65536];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), f)) > 0)
        d.insert(d.end(), buf, buf + n);
    fclose(f);
    if (d.size() < 44 || memcmp(d.data(), "RIFF", 4) != 0 || memcmp(d.data() + 8, "WAVE", 4) != 0 ||
        memcmp(d.data() + 12, "fmt ", 4) != 0 || memcmp(d.data() + 36, "data", 4) != 0) {
        w.why = "no RIFF/WAVE header";
        return w;
    }
    if (Le32(d.data() + 4) != d.size() - 8) {
        w.why = "RIFF size " + std::to_string(Le32(d.data() + 4)) + " for a file of " +
                std::to_string(d.size()) + " bytes";
        return w;
    }
    uint32_t dataLen = Le32(d.data() + 40);
    if (dataLen != d.size() - 44) {
        w.why = "data size " + std::to_string(dataLen) + " for a file of " +
                std::to_string(d.size()) + " bytes";
        return w;
    }
    int format = d[20] | (d[21] << 8);
    w.channels = d[22] | (d[23] << 8);
    w.rate = static_cast<int>(Le32(d.data() + 24));
    int bits = d[34] | (d[35] << 8);
    if (format != 1 || bits != 16 || w.channels < 1 || w.rate <= 0) {
        w.why = "not 16-bit PCM";
        return w;
    }
    w.samples.resize(dataLen / 2);
    for (size_t i = 0; i < w.samples.size(); ++i)
        w.samples[i] = static_cast<int16_t>(d[44 + 2 * i] | (d[45 + 2 * i] << 8));
    w.ok = true;
    return w;
}

// Seconds of audio written so far into a WAV file (44100 Hz stereo S16).
inline double WavSecondsNow(const std::string &path)
{
    struct stat st;
    if (stat(path.c_str(), &st) != 0 || st.st_size < 44)
        return 0.0;
    return (st.st_size - 44) / (44100.0 * 4);
}

inline std::string ReadFile(const std::string &path)
{
    std::string s;
    FILE *f = fopen(path.c_str(), "rb");
    if (!f)
        return s;
    char buf[4096];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), f)) > 0)
        s.append(buf, n);
    fclose(f);
    return s;
}

}  // namespace mptest

#endif
