// Side-by-side benchmark: tarnaudiod against Music Player Daemon (mpd).
//
// Starts both daemons in private directories and measures the same work on
// both in one run with the same client code (raw Unix sockets, no process
// start inside a timing). Prints one table with both figures and their
// ratio (ours / mpd) per row. Nothing here asserts a time.
//
//   bench/compare [--quick]
//
// Must run in a private network namespace (bench/compare arranges it): the
// daemon sends SSDP searches when it starts.
#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <chrono>
#include <cmath>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sched.h>
#include <fstream>
#include <sstream>
#include <string>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>
#include <dirent.h>

#include "platform/fd_read.h"
#include "daemon/ctrl.h"
#include "daemon/tarn_types.h"
#include "platform/tarn_shm.h"
#include "tests/tools/fakedevice/fake_device.h"

#ifndef TARN_BIN_DIR
#define TARN_BIN_DIR "build/bin"
#endif

namespace {

using Clock = std::chrono::steady_clock;

bool g_quick = false;
// Sections to run (--only); empty: all of them.
std::vector<std::string> g_only;

bool Wanted(const char *section)
{
    if (g_only.empty())
        return true;
    for (const std::string &s : g_only)
        if (s == section)
            return true;
    return false;
}

double NowSec()
{
    return std::chrono::duration<double>(Clock::now().time_since_epoch()).count();
}

void Die(const std::string &what)
{
    fprintf(stderr, "compare: %s\n", what.c_str());
    exit(1);
}

void Progress(const char *fmt, ...) __attribute__((format(printf, 1, 2)));
void Progress(const char *fmt, ...)
{
    va_list ap;
    va_start(ap, fmt);
    fprintf(stderr, "[compare] ");
    vfprintf(stderr, fmt, ap);
    fprintf(stderr, "\n");
    va_end(ap);
}

int Run(const std::string &cmd)
{
    int rc = system(cmd.c_str());
    return WIFEXITED(rc) ? WEXITSTATUS(rc) : -1;
}

void MkdirP(const std::string &path)
{
    Run("mkdir -p '" + path + "'");
}

// ---------------------------------------------------------------------------
// Process figures from /proc.
struct ProcFigures {
    double cpuSec = 0;
    long ctxSwitches = 0;
    long rssKb = 0;
};

ProcFigures ReadProc(pid_t pid)
{
    ProcFigures f;
    std::ifstream st("/proc/" + std::to_string(pid) + "/stat");
    std::string line;
    std::getline(st, line);
    size_t rp = line.rfind(')');
    if (rp != std::string::npos) {
        std::istringstream is(line.substr(rp + 2));
        std::string tok;
        std::vector<std::string> fields;
        while (is >> tok)
            fields.push_back(tok);
        // fields[0] is the state (stat field 3); utime is field 14, stime 15.
        if (fields.size() > 13) {
            long ticks = sysconf(_SC_CLK_TCK);
            f.cpuSec = (atof(fields[11].c_str()) + atof(fields[12].c_str())) / ticks;
        }
    }
    std::string taskDir = "/proc/" + std::to_string(pid) + "/task";
    DIR *d = opendir(taskDir.c_str());
    if (d) {
        while (dirent *e = readdir(d)) {
            if (e->d_name[0] == '.')
                continue;
            std::ifstream ts(taskDir + "/" + e->d_name + "/status");
            while (std::getline(ts, line)) {
                if (line.rfind("voluntary_ctxt_switches:", 0) == 0 ||
                    line.rfind("nonvoluntary_ctxt_switches:", 0) == 0)
                    f.ctxSwitches += atol(line.substr(line.find(':') + 1).c_str());
            }
        }
        closedir(d);
    }
    std::ifstream ss("/proc/" + std::to_string(pid) + "/status");
    while (std::getline(ss, line))
        if (line.rfind("VmRSS:", 0) == 0)
            f.rssKb = atol(line.substr(6).c_str());
    return f;
}

// ---------------------------------------------------------------------------
// Statistics.
struct Stat {
    double median = NAN, min = NAN, max = NAN;
};

Stat Summarise(std::vector<double> v)
{
    Stat s;
    v.erase(std::remove_if(v.begin(), v.end(), [](double x) { return std::isnan(x); }), v.end());
    if (v.empty())
        return s;
    std::sort(v.begin(), v.end());
    size_t n = v.size();
    s.median = n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
    s.min = v.front();
    s.max = v.back();
    return s;
}

double Percentile(std::vector<double> v, double p)
{
    if (v.empty())
        return NAN;
    std::sort(v.begin(), v.end());
    size_t i = static_cast<size_t>(std::ceil(p / 100.0 * v.size())) - 1;
    return v[std::min(i, v.size() - 1)];
}

// ---------------------------------------------------------------------------
// Raw Unix socket client (for the other daemon).
int ConnectUnix(const std::string &path)
{
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    sockaddr_un a{};
    a.sun_family = AF_UNIX;
    snprintf(a.sun_path, sizeof(a.sun_path), "%s", path.c_str());
    if (connect(fd, reinterpret_cast<sockaddr *>(&a), sizeof(a)) != 0) {
        close(fd);
        return -1;
    }
    timeval tv{5, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
    return fd;
}

bool WriteAll(int fd, const void *buf, size_t len)
{
    const char *p = static_cast<const char *>(buf);
    while (len > 0) {
        ssize_t w = write(fd, p, len);
        if (w < 0 && errno == EINTR)
            continue;
        if (w <= 0)
            return false;
        p += w;
        len -= static_cast<size_t>(w);
    }
    return true;
}

// ---------------------------------------------------------------------------
// Our side.
struct Ours {
    std::string root;
    std::string sock;
    pid_t pid = -1;
    int shmKey = 0;
    std::string wav;

    bool Request(int action, const void *param, size_t len, std::string *reply)
    {
        static thread_local ControlRequest req;
        memset(&req, 0, sizeof(req));
        req.action = action;
        if (param && len)
            memcpy(req.parameter, param, std::min(len, sizeof(req.parameter)));
        int fd = CtrlConnectAt(sock.c_str(), false, nullptr);
        if (fd < 0)
            return false;
        // One write: the daemon refuses a request that arrives in pieces.
        if (write(fd, &req, sizeof(req)) != static_cast<ssize_t>(sizeof(req))) {
            close(fd);
            return false;
        }
        std::string data;
        // Done with the whole reply, as the other daemon's is done at "OK".
        TarnReadUntilClosed(fd, 5000, &data, CTRL_REPLY_SIZE);
        close(fd);
        if (data.empty())
            return false;
        if (reply)
            reply->assign(data.c_str(), strnlen(data.c_str(), data.size()));
        return true;
    }
    bool Text(int action, const std::string &text, std::string *reply = nullptr)
    {
        return Request(action, text.c_str(), text.size() + 1, reply);
    }
    bool AddSong(const std::string &path, uint32_t id)
    {
        static thread_local TARN_MEDIA_INFO info;
        memset(&info, 0, sizeof(info));
        info.id = id;
        snprintf(info.path, sizeof(info.path), "%s", path.c_str());
        const char *slash = strrchr(path.c_str(), '/');
        snprintf(info.title, sizeof(info.title), "%s", slash ? slash + 1 : path.c_str());
        snprintf(info.artist, sizeof(info.artist), "Bench Artist");
        snprintf(info.album, sizeof(info.album), "Bench Album");
        info.duration = 3.0f;
        return Request(ACT_QUEUE_ADD, &info, sizeof(info), nullptr);
    }
    PublishedStatusShm *Published()
    {
        static PublishedStatusShm *seg = nullptr;
        if (!seg) {
            void *p = TarnShmAttach(shmKey + 1, sizeof(PublishedStatusShm), TARN_SHM_READONLY);
            if (!p)
                return nullptr;
            seg = static_cast<PublishedStatusShm *>(p);
        }
        return seg;
    }
    pid_t PlayerPid()
    {
        std::ifstream f(root + "/var/run/mplayer.daemon.pid");
        long p = 0;
        f >> p;
        return static_cast<pid_t>(p);
    }
};

void StartOurs(Ours &o, const std::string &base)
{
    o.root = base + "/ours";
    std::string bin = TARN_BIN_DIR;
    // Laid out by the install rules, as every root is.
    if (Run(std::string("'") + TARN_SOURCE_DIR + "/scripts/make-root.sh' --build '" + TARN_BUILD_DIR +
            "' --component player '" + o.root + "'") != 0)
        Die("cannot lay out the private root " + o.root + " (scripts/make-root.sh)");
    o.sock = o.root + "/tmp/tarnaudiod.sock";
    o.shmKey = 0x5a000000 + (getpid() & 0xffff) * 4;
    o.wav = base + "/ours.wav";
    std::string env = "TARN_ROOT='" + o.root + "' TARN_SHM_KEY=" + std::to_string(o.shmKey) +
                      " TARN_LOG_FILE='" + o.root + "/log.txt' TARN_AUDIO_OUT='wav:" + o.wav + "'";
    if (Run(env + " '" + bin + "/tarnaudiod'") != 0)
        Die("tarnaudiod did not start (see " + o.root + "/log.txt)");
    for (int i = 0; i < 100; ++i) {
        std::ifstream f(o.root + "/var/run/tarnaudiod.pid");
        long p = 0;
        if (f >> p && p > 0 && access(o.sock.c_str(), F_OK) == 0) {
            o.pid = static_cast<pid_t>(p);
            break;
        }
        usleep(50000);
    }
    if (o.pid <= 0 || !o.Text(ACT_GET_STATUS, ""))
        Die("tarnaudiod is not answering on " + o.sock + " (see " + o.root + "/log.txt)");
}

void StopOurs(Ours &o)
{
    if (o.pid > 0) {
        kill(o.pid, SIGTERM);
        for (int i = 0; i < 100 && kill(o.pid, 0) == 0; ++i) {
            waitpid(-1, nullptr, WNOHANG);
            usleep(50000);
        }
    }
}

// ---------------------------------------------------------------------------
// MPD side.
struct Mpd {
    std::string dir;
    std::string sock;
    pid_t pid = -1;
    std::string capture;

    // Reads until "OK\n" or "ACK ..." at line start.
    static bool ReadResponse(int fd, std::string *out)
    {
        std::string acc;
        char buf[65536];
        for (;;) {
            ssize_t r = read(fd, buf, sizeof(buf));
            if (r < 0 && errno == EINTR)
                continue;
            if (r <= 0)
                return false;
            acc.append(buf, static_cast<size_t>(r));
            if ((acc.size() >= 3 && acc.compare(acc.size() - 3, 3, "OK\n") == 0 &&
                 (acc.size() == 3 || acc[acc.size() - 4] == '\n')) ||
                acc.rfind("ACK ", 0) == 0 || acc.find("\nACK ") != std::string::npos) {
                if (out)
                    *out = acc;
                return acc.find("ACK ") == std::string::npos;
            }
        }
    }
    int Open()
    {
        int fd = ConnectUnix(sock);
        if (fd < 0)
            return -1;
        // Greeting "OK MPD x.y.z".
        char buf[256];
        size_t got = 0;
        while (got < sizeof(buf)) {
            ssize_t r = read(fd, buf + got, sizeof(buf) - got);
            if (r <= 0) {
                close(fd);
                return -1;
            }
            got += static_cast<size_t>(r);
            if (buf[got - 1] == '\n')
                break;
        }
        return fd;
    }
    bool Command(int fd, const std::string &cmd, std::string *out = nullptr)
    {
        std::string line = cmd + "\n";
        if (!WriteAll(fd, line.data(), line.size()))
            return false;
        return ReadResponse(fd, out);
    }
    // One command on a fresh connection.
    bool Fresh(const std::string &cmd, std::string *out = nullptr)
    {
        int fd = Open();
        if (fd < 0)
            return false;
        bool ok = Command(fd, cmd, out);
        close(fd);
        return ok;
    }
};

std::string MpdField(const std::string &resp, const std::string &key)
{
    std::string k = "\n" + key + ": ";
    std::string r = "\n" + resp;
    size_t p = r.find(k);
    if (p == std::string::npos)
        return "";
    p += k.size();
    return r.substr(p, r.find('\n', p) - p);
}

void StartMpd(Mpd &m, const std::string &base)
{
    m.dir = base + "/mpd";
    MkdirP(m.dir + "/music");
    MkdirP(m.dir + "/playlists");
    m.sock = m.dir + "/socket";
    m.capture = base + "/mpd.raw";
    std::ofstream c(m.dir + "/mpd.conf");
    c << "music_directory \"" << m.dir << "/music\"\n"
      << "playlist_directory \"" << m.dir << "/playlists\"\n"
      << "db_file \"" << m.dir << "/db\"\n"
      << "log_file \"" << m.dir << "/log\"\n"
      << "pid_file \"" << m.dir << "/pid\"\n"
      << "bind_to_address \"" << m.sock << "\"\n"
      << "zeroconf_enabled \"no\"\n"
      << "auto_update \"no\"\n"
      << "max_playlist_length \"20000\"\n"
      << "audio_output {\n  type \"null\"\n  name \"paced\"\n  sync \"yes\"\n  mixer_type \"none\"\n}\n"
      << "audio_output {\n  type \"pipe\"\n  name \"capture\"\n  command \"cat > " << m.capture
      << "\"\n  format \"44100:16:2\"\n  mixer_type \"none\"\n}\n";
    c.close();
    pid_t pid = fork();
    if (pid == 0) {
        int devnull = open("/dev/null", O_RDWR);
        dup2(devnull, 0);
        dup2(devnull, 1);
        dup2(devnull, 2);
        execlp("mpd", "mpd", "--no-daemon", (m.dir + "/mpd.conf").c_str(), (char *)nullptr);
        _exit(127);
    }
    m.pid = pid;
    for (int i = 0; i < 100; ++i) {
        int fd = m.Open();
        if (fd >= 0) {
            close(fd);
            return;
        }
        usleep(50000);
    }
    Die("mpd did not start (see " + m.dir + "/log)");
}

void StopMpd(Mpd &m)
{
    if (m.pid > 0) {
        kill(m.pid, SIGTERM);
        waitpid(m.pid, nullptr, 0);
    }
}

// ---------------------------------------------------------------------------
// Audio files and analysis.
struct Songs {
    std::string mp3a, mp3b, flaca, flacb, longMp3;
};

Songs MakeSongs(const std::string &base)
{
    Songs s;
    std::string d = base + "/songs";
    MkdirP(d);
    int len = g_quick ? 3 : 4;
    int longLen = g_quick ? 15 : 40;
    std::string cmds =
        "cd '" + d + "' && "
        "sox -n -r 44100 -c 2 -b 16 a.wav synth " + std::to_string(len) + " sine 440 vol 0.5 && "
        "sox -n -r 44100 -c 2 -b 16 b.wav synth " + std::to_string(len) + " sine 880 vol 0.5 && "
        "sox -n -r 44100 -c 2 -b 16 long.wav synth " + std::to_string(longLen) + " sine 660 vol 0.5 && "
        "lame --quiet -b 192 a.wav a.mp3 && lame --quiet -b 192 b.wav b.mp3 && "
        "lame --quiet -b 192 long.wav long.mp3 && "
        "flac -s -f a.wav -o a.flac && flac -s -f b.wav -o b.flac";
    if (Run(cmds) != 0)
        Die("could not generate the test songs (needs sox, lame, flac: run scripts/setup.sh)");
    s.mp3a = d + "/a.mp3";
    s.mp3b = d + "/b.mp3";
    s.flaca = d + "/a.flac";
    s.flacb = d + "/b.flac";
    s.longMp3 = d + "/long.mp3";
    return s;
}

// Mono amplitude samples of a WAV file (16-bit or float) or of raw 16-bit
// stereo, at the file's rate.
bool LoadPcm(const std::string &path, bool raw, std::vector<float> &mono, int &rate)
{
    std::ifstream f(path, std::ios::binary);
    if (!f)
        return false;
    std::vector<char> data((std::istreambuf_iterator<char>(f)), std::istreambuf_iterator<char>());
    int channels = 2, bits = 16, format = 1;
    rate = 44100;
    size_t off = 0, len = data.size();
    if (!raw) {
        if (data.size() < 44 || memcmp(data.data(), "RIFF", 4) != 0)
            return false;
        size_t p = 12;
        bool haveData = false;
        while (p + 8 <= data.size()) {
            uint32_t sz;
            memcpy(&sz, &data[p + 4], 4);
            if (memcmp(&data[p], "fmt ", 4) == 0 && p + 24 <= data.size()) {
                uint16_t fmt, ch, bps;
                uint32_t sr;
                memcpy(&fmt, &data[p + 8], 2);
                memcpy(&ch, &data[p + 10], 2);
                memcpy(&sr, &data[p + 12], 4);
                memcpy(&bps, &data[p + 22], 2);
                format = fmt;
                channels = ch;
                rate = static_cast<int>(sr);
                bits = bps;
            } else if (memcmp(&data[p], "data", 4) == 0) {
                off = p + 8;
                // A header that was never finalised says 0 or too much.
                len = (sz == 0 || off + sz > data.size()) ? data.size() - off : sz;
                haveData = true;
                break;
            }
            p += 8 + sz + (sz & 1);
        }
        if (!haveData)
            return false;
    }
    size_t frameBytes = static_cast<size_t>(channels) * (bits / 8);
    if (frameBytes == 0)
        return false;
    size_t frames = len / frameBytes;
    mono.resize(frames);
    for (size_t i = 0; i < frames; ++i) {
        const char *fr = &data[off + i * frameBytes];
        float v = 0;
        if (format == 3 && bits == 32) {
            float x;
            memcpy(&x, fr, 4);
            v = x;
        } else if (bits == 16) {
            int16_t x;
            memcpy(&x, fr, 2);
            v = x / 32768.0f;
        } else if (bits == 32) {
            int32_t x;
            memcpy(&x, fr, 4);
            v = x / 2147483648.0f;
        }
        mono[i] = v;
    }
    return true;
}

// Longest run of near-silence between the first and the last sound of the
// capture, in milliseconds (0 for a gapless transition).
double GapMs(const std::vector<float> &pcm, int rate)
{
    const float thr = 0.01f;
    size_t first = 0, last = pcm.size();
    while (first < pcm.size() && std::fabs(pcm[first]) < thr)
        ++first;
    while (last > first && std::fabs(pcm[last - 1]) < thr)
        --last;
    if (last <= first + static_cast<size_t>(rate))
        return NAN;
    size_t longest = 0, run = 0;
    for (size_t i = first; i < last; ++i) {
        if (std::fabs(pcm[i]) < thr) {
            ++run;
            longest = std::max(longest, run);
        } else {
            run = 0;
        }
    }
    // A sine crosses zero for a sample or two; that is not silence.
    if (longest < 8)
        longest = 0;
    return 1000.0 * longest / rate;
}

// ---------------------------------------------------------------------------
// The table.
struct Row {
    std::string name;
    std::string unit;
    Stat ours, mpd;
};
std::vector<Row> g_rows;

void AddRow(const std::string &name, const std::string &unit, const std::vector<double> &ours,
            const std::vector<double> &mpd)
{
    g_rows.push_back({name, unit, Summarise(ours), Summarise(mpd)});
}

std::string Fmt(const Stat &s)
{
    char b[128];
    if (std::isnan(s.median))
        return "n/a";
    if (s.min == s.max)
        snprintf(b, sizeof(b), "%.4g", s.median);
    else
        snprintf(b, sizeof(b), "%.4g (%.4g..%.4g)", s.median, s.min, s.max);
    return b;
}

void PrintTable()
{
    printf("\n| row | unit | tarnaudiod median (min..max) | mpd median (min..max) | ratio ours/mpd |\n");
    printf("|---|---|---|---|---|\n");
    for (const Row &r : g_rows) {
        char ratio[32] = "n/a";
        if (!std::isnan(r.ours.median) && !std::isnan(r.mpd.median) && r.mpd.median != 0)
            snprintf(ratio, sizeof(ratio), "%.2f", r.ours.median / r.mpd.median);
        printf("| %s | %s | %s | %s | %s |\n", r.name.c_str(), r.unit.c_str(), Fmt(r.ours).c_str(),
               Fmt(r.mpd).c_str(), ratio);
    }
    fflush(stdout);
}

// ---------------------------------------------------------------------------
// Measurements.

// Pins every thread of pid (pid 0: the calling thread) to one CPU, or with
// cpu < 0 lets it run on all of them again. On a virtual machine a wake-up
// across CPUs costs several times a wake-up on the same one, and where the
// scheduler puts a client and a daemon decides a whole run.
void Pin(pid_t pid, int cpu)
{
    cpu_set_t set;
    CPU_ZERO(&set);
    long cpus = sysconf(_SC_NPROCESSORS_ONLN);
    for (long c = 0; c < cpus && c < CPU_SETSIZE; ++c)
        if (cpu < 0 || c == cpu)
            CPU_SET(c, &set);
    if (pid == 0) {
        sched_setaffinity(0, sizeof(set), &set);
        return;
    }
    DIR *d = opendir(("/proc/" + std::to_string(pid) + "/task").c_str());
    if (!d)
        return;
    while (struct dirent *e = readdir(d)) {
        int tid = atoi(e->d_name);
        if (tid > 0)
            sched_setaffinity(tid, sizeof(set), &set);
    }
    closedir(d);
}

// n fresh-connection status requests to each daemon, times in us. The two
// take turns in blocks, so that both meet the same placements of the client
// on the CPUs (a placement tends to last, and decides a wake-up's cost).
void MeasureRoundTrips(Ours &o, Mpd &m, int n, std::vector<double> *to, std::vector<double> *tm)
{
    const int block = 250;
    for (int done = 0; done < n; done += block) {
        for (int i = done; i < n && i < done + block; ++i) {
            auto t0 = Clock::now();
            if (!o.Text(ACT_GET_STATUS, ""))
                Die("tarnaudiod stopped answering during the round-trip run");
            to->push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
        }
        for (int i = done; i < n && i < done + block; ++i) {
            auto t0 = Clock::now();
            if (!m.Fresh("status"))
                Die("mpd stopped answering during the round-trip run");
            tm->push_back(std::chrono::duration<double, std::micro>(Clock::now() - t0).count());
        }
    }
}

// Round trips where the scheduler puts them, then with the client and both
// daemons on CPU 0.
void RoundTrips(Ours &o, Mpd &m, int repeats)
{
    int n = g_quick ? 500 : 5000;
    std::vector<double> o50, o99, m50, m99, p50o, p50m;
    // repeats runs; p50 and (when asked) p99 of each side's run.
    auto runs = [&](const char *what, std::vector<double> *ours50, std::vector<double> *ours99,
                    std::vector<double> *mpd50, std::vector<double> *mpd99) {
        for (int r = 0; r < repeats; ++r) {
            Progress("round trips%s, run %d/%d (%d requests each side)", what, r + 1, repeats, n);
            std::vector<double> to, tm;
            MeasureRoundTrips(o, m, n, &to, &tm);
            ours50->push_back(Percentile(to, 50));
            mpd50->push_back(Percentile(tm, 50));
            if (ours99) {
                ours99->push_back(Percentile(to, 99));
                mpd99->push_back(Percentile(tm, 99));
            }
        }
    };
    runs("", &o50, &o99, &m50, &m99);
    for (pid_t pid : {static_cast<pid_t>(0), o.pid, m.pid})
        Pin(pid, 0);
    runs(" on one CPU", &p50o, nullptr, &p50m, nullptr);
    for (pid_t pid : {static_cast<pid_t>(0), o.pid, m.pid})
        Pin(pid, -1);
    AddRow("control round trip p50, fresh connection", "us", o50, m50);
    AddRow("control round trip p99, fresh connection", "us", o99, m99);
    AddRow("control round trip p50, client and daemons on one CPU", "us", p50o, p50m);
}

template <typename F>
double Throughput(F one, int clients, double seconds)
{
    std::atomic<long> count{0};
    std::atomic<bool> stop{false};
    std::vector<std::thread> th;
    for (int c = 0; c < clients; ++c)
        th.emplace_back([&] {
            while (!stop.load()) {
                if (one())
                    count.fetch_add(1);
            }
        });
    std::this_thread::sleep_for(std::chrono::duration<double>(seconds));
    stop = true;
    for (auto &t : th)
        t.join();
    return count.load() / seconds;
}

void RequestsPerSecond(Ours &o, Mpd &m, int repeats)
{
    double secs = g_quick ? 2 : 10;
    std::vector<double> vo, vm;
    for (int r = 0; r < repeats; ++r) {
        Progress("throughput, run %d/%d (8 clients, %.0f s each side)", r + 1, repeats, secs);
        vo.push_back(Throughput([&] { return o.Text(ACT_GET_STATUS, ""); }, 8, secs));
        vm.push_back(Throughput([&] { return m.Fresh("status"); }, 8, secs));
    }
    AddRow("requests per second, 8 clients, fresh connection", "req/s", vo, vm);
}

void Idle(Ours &o, Mpd &m)
{
    int windows = 3;
    double secs = g_quick ? 3 : 10;
    std::vector<double> oc, mc, ox, mx;
    for (int w = 0; w < windows; ++w) {
        Progress("idle, window %d/%d (%.0f s, both daemons at once)", w + 1, windows, secs);
        ProcFigures o0 = ReadProc(o.pid), m0 = ReadProc(m.pid);
        std::this_thread::sleep_for(std::chrono::duration<double>(secs));
        ProcFigures o1 = ReadProc(o.pid), m1 = ReadProc(m.pid);
        // Scaled to the 30 s of the row.
        oc.push_back((o1.cpuSec - o0.cpuSec) * 30 / secs);
        mc.push_back((m1.cpuSec - m0.cpuSec) * 30 / secs);
        ox.push_back((o1.ctxSwitches - o0.ctxSwitches) * 30 / secs);
        mx.push_back((m1.ctxSwitches - m0.ctxSwitches) * 30 / secs);
    }
    AddRow("CPU while idle, per 30 s", "s", oc, mc);
    AddRow("context switches while idle, per 30 s", "count", ox, mx);
    AddRow("resident memory idle", "MiB", {ReadProc(o.pid).rssKb / 1024.0}, {ReadProc(m.pid).rssKb / 1024.0});
}

// A good client's round trips while 3 other clients are connected and say
// nothing (they stay connected for the whole window).
void SilentClients(Ours &o, Mpd &m, int repeats)
{
    int n = g_quick ? 200 : 1000;
    std::vector<double> o50, omax, m50, mmax;
    for (int r = 0; r < repeats; ++r) {
        Progress("silent clients, run %d/%d (3 silent, %d requests each side)", r + 1, repeats, n);
        std::vector<int> silent;
        for (int i = 0; i < 3; ++i) {
            silent.push_back(CtrlConnectAt(o.sock.c_str(), false, nullptr));
            silent.push_back(ConnectUnix(m.sock));
        }
        std::vector<double> to, tm;
        for (int i = 0; i < n; ++i) {
            auto t0 = Clock::now();
            if (!o.Text(ACT_GET_STATUS, ""))
                Die("tarnaudiod stopped answering with silent clients connected");
            to.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
            t0 = Clock::now();
            if (!m.Fresh("status"))
                Die("mpd stopped answering with silent clients connected");
            tm.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
        }
        for (int fd : silent) {
            if (fd >= 0)
                close(fd);
        }
        o50.push_back(Percentile(to, 50));
        omax.push_back(Percentile(to, 100));
        m50.push_back(Percentile(tm, 50));
        mmax.push_back(Percentile(tm, 100));
    }
    AddRow("reply while 3 clients are connected and silent, p50", "ms", o50, m50);
    AddRow("reply while 3 clients are connected and silent, max", "ms", omax, mmax);
}

// Status requests while ACT_PLAY_INDEX waits on a renderer that stopped
// answering (gmediarender, SIGSTOPped). Ours only: mpd has no renderers.
void HungRenderer(Ours &o, const Songs &s)
{
    std::string daemonIp = fakedev::ListeningAddress(49152), ip, iface;
    if (daemonIp.empty() || access("/usr/bin/gmediarender", X_OK) != 0) {
        Progress("hung renderer: skipped (no UPnP address or no gmediarender)");
        return;
    }
    fakedev::PeerInterface(daemonIp, ip, iface);
    pid_t renderer = fork();
    if (renderer == 0) {
        int null = open("/dev/null", O_RDWR);
        dup2(null, 1);
        dup2(null, 2);
        execl("/usr/bin/gmediarender", "gmediarender", "-I", iface.c_str(), "-p", "49495", "-f",
              "Compare Renderer", "-u", "5c1e2c3b-4a59-4687-9a0b-c1d2e3f4a5b7", "--gstout-audiopipe",
              "fakesink sync=true", static_cast<char *>(nullptr));
        _exit(127);
    }
    Progress("hung renderer: waiting for gmediarender to be listed (up to 60 s)");
    int index = -1;
    for (int i = 0; i < 200 && index < 0; ++i) {
        std::string reply;
        o.Text(ACT_LIST_RENDERERS, "0 0", &reply);
        size_t at = reply.find("Compare Renderer");
        size_t idx = at == std::string::npos ? at : reply.find("\"index\"", at);
        if (idx != std::string::npos)
            index = atoi(reply.c_str() + reply.find(':', idx) + 1);
        if (i % 30 == 29)
            o.Text(ACT_SEARCH_RENDERERS, "");
        usleep(300 * 1000);
    }
    std::vector<double> t;
    if (index >= 0 && o.Text(ACT_SELECT_PLAYER, std::to_string(index)) && o.AddSong(s.mp3a, 1)) {
        kill(renderer, SIGSTOP);
        usleep(100 * 1000);
        auto t0 = Clock::now();
        o.Text(ACT_PLAY_INDEX, "0");
        double reply = std::chrono::duration<double, std::milli>(Clock::now() - t0).count();
        for (int i = 0; i < 50; ++i) {
            t0 = Clock::now();
            if (!o.Text(ACT_GET_STATUS, ""))
                Die("tarnaudiod stopped answering while a renderer hung");
            t.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
            usleep(20 * 1000);
        }
        AddRow("ACT_PLAY_INDEX reply with the renderer hung", "ms", {reply}, {NAN});
        AddRow("status request while the renderer hangs, max of 50", "ms", {Percentile(t, 100)}, {NAN});
        kill(renderer, SIGCONT);
    } else {
        Progress("hung renderer: gmediarender was not listed; row left out");
    }
    kill(renderer, SIGKILL);
    waitpid(renderer, nullptr, 0);
    o.Text(ACT_SELECT_PLAYER, "-1");
    o.Text(ACT_QUEUE_CLEAR, "");
}

int LargestOurPage(Ours &o)
{
    int best = 1;
    for (int n = 1; n <= 60; ++n) {
        std::string reply;
        if (!o.Text(ACT_QUEUE_LIST, "0 " + std::to_string(n), &reply))
            break;
        // A page that does not fit holds fewer entries than asked for.
        size_t entries = 0;
        for (size_t at = reply.find("\"sequence\""); at != std::string::npos;
             at = reply.find("\"sequence\"", at + 1))
            entries++;
        if (entries < static_cast<size_t>(n))
            break;
        best = n;
    }
    return best;
}

void QueueRows(Ours &o, Mpd &m, const Songs &s, int repeats)
{
    int n = g_quick ? 1000 : 10000;
    std::vector<double> oa, ma, orss, mrss;
    for (int r = 0; r < repeats; ++r) {
        Progress("queue add, run %d/%d (%d songs each side)", r + 1, repeats, n);
        o.Text(ACT_QUEUE_CLEAR, "");
        double t0 = NowSec();
        for (int i = 0; i < n; ++i)
            if (!o.AddSong(i % 2 ? s.mp3b : s.mp3a, static_cast<uint32_t>(i + 1)))
                Die("tarnaudiod refused a queue add");
        oa.push_back(NowSec() - t0);
        orss.push_back(ReadProc(o.pid).rssKb / 1024.0);

        int fd = m.Open();
        if (fd < 0)
            Die("mpd is not answering");
        m.Command(fd, "clear");
        t0 = NowSec();
        for (int i = 0; i < n; ++i) {
            std::string err;
            if (!m.Command(fd, "add \"file://" + (i % 2 ? s.mp3b : s.mp3a) + "\"", &err))
                Die("mpd refused add: " + err);
        }
        ma.push_back(NowSec() - t0);
        close(fd);
        mrss.push_back(ReadProc(m.pid).rssKb / 1024.0);
    }
    AddRow("adding " + std::to_string(n) + " songs, one request each", "s", oa, ma);
    AddRow("resident memory after adding", "MiB", orss, mrss);

    int page = LargestOurPage(o);
    int at = n / 2;
    int k = g_quick ? 50 : 200;
    std::vector<double> os, oe, ms, me;
    for (int i = 0; i < k; ++i) {
        double t0 = NowSec();
        o.Text(ACT_QUEUE_LIST, "0 " + std::to_string(page));
        os.push_back((NowSec() - t0) * 1e6);
        t0 = NowSec();
        o.Text(ACT_QUEUE_LIST, std::to_string(at) + " " + std::to_string(page));
        oe.push_back((NowSec() - t0) * 1e6);
        t0 = NowSec();
        m.Fresh("playlistinfo 0:" + std::to_string(page));
        ms.push_back((NowSec() - t0) * 1e6);
        t0 = NowSec();
        m.Fresh("playlistinfo " + std::to_string(at) + ":" + std::to_string(at + page));
        me.push_back((NowSec() - t0) * 1e6);
    }
    AddRow("queue page of " + std::to_string(page) + " at the start", "us", {Summarise(os).median},
           {Summarise(ms).median});
    AddRow("queue page of " + std::to_string(page) + " at position " + std::to_string(at), "us",
           {Summarise(oe).median}, {Summarise(me).median});
    o.Text(ACT_QUEUE_CLEAR, "");
    m.Fresh("clear");
}

void PlayStart(Ours &o, Mpd &m, const Songs &s, int repeats)
{
    std::vector<double> o2, op, m2, mp;
    o.Text(ACT_QUEUE_CLEAR, "");
    o.AddSong(s.longMp3, 1);
    m.Fresh("clear");
    m.Fresh("add \"file://" + s.longMp3 + "\"");
    PublishedStatusShm *seg = o.Published();
    if (!seg)
        Die("cannot attach tarnaudiod's published status segment");
    for (int r = 0; r < repeats; ++r) {
        Progress("play start, run %d/%d", r + 1, repeats);
        o.Text(ACT_STOP, "");
        usleep(300000);
        double t0 = NowSec(), tPlay = NAN, tPos = NAN;
        o.Text(ACT_PLAY_INDEX, "0");
        // The segment keeps the last song's position until the new player
        // reports; count only a position that grew from the new start.
        bool sawStart = false;
        while (NowSec() - t0 < 10 && std::isnan(tPos)) {
            if (std::isnan(tPlay) && seg->state == PLAYER_STATE_PLAYING)
                tPlay = NowSec() - t0;
            if (seg->state == PLAYER_STATE_PLAYING && seg->position == 0)
                sawStart = true;
            if (sawStart && seg->position > 0)
                tPos = NowSec() - t0;
            usleep(1000);
        }
        o2.push_back(tPlay * 1000);
        op.push_back(tPos * 1000);
        o.Text(ACT_STOP, "");

        m.Fresh("stop");
        usleep(300000);
        int fd = m.Open();
        t0 = NowSec();
        tPlay = tPos = NAN;
        m.Command(fd, "play 0");
        while (NowSec() - t0 < 10 && std::isnan(tPos)) {
            std::string st;
            m.Command(fd, "status", &st);
            if (MpdField(st, "state") == "play") {
                if (std::isnan(tPlay))
                    tPlay = NowSec() - t0;
                if (atof(MpdField(st, "elapsed").c_str()) > 0)
                    tPos = NowSec() - t0;
            }
            usleep(1000);
        }
        close(fd);
        m2.push_back(tPlay * 1000);
        mp.push_back(tPos * 1000);
        m.Fresh("stop");
    }
    AddRow("play start: request to state playing", "ms", o2, m2);
    AddRow("play start: request to position > 0 (ours counts whole seconds)", "ms", op, mp);
}

void Gaps(Ours &o, Mpd &m, const Songs &s, int repeats)
{
    struct Pair {
        const char *name;
        std::string a, b;
    } pairs[] = {{"mp3", s.mp3a, s.mp3b}, {"flac", s.flaca, s.flacb}};
    double songLen = g_quick ? 3 : 4;
    for (const Pair &p : pairs) {
        std::vector<double> og, mg;
        for (int r = 0; r < repeats; ++r) {
            Progress("gap between songs (%s), run %d/%d, both daemons at once", p.name, r + 1, repeats);
            o.Text(ACT_STOP, "");
            o.Text(ACT_QUEUE_CLEAR, "");
            o.AddSong(p.a, 1);
            o.AddSong(p.b, 2);
            m.Fresh("stop");
            m.Fresh("clear");
            m.Fresh("add \"file://" + p.a + "\"");
            m.Fresh("add \"file://" + p.b + "\"");
            unlink(o.wav.c_str());
            o.Text(ACT_PLAY_INDEX, "0");
            m.Fresh("play 0");
            double t0 = NowSec();
            // Both songs, then the queue ends by itself on both sides.
            while (NowSec() - t0 < 2 * songLen + 8) {
                std::string st;
                m.Fresh("status", &st);
                bool mpdDone = MpdField(st, "state") == "stop" && NowSec() - t0 > songLen;
                pid_t pp = o.PlayerPid();
                bool oursDone = NowSec() - t0 > 2 * songLen + 1 && (pp <= 0 || kill(pp, 0) != 0);
                if (mpdDone && oursDone)
                    break;
                usleep(100000);
            }
            o.Text(ACT_STOP, "");
            m.Fresh("stop");
            usleep(500000);
            std::vector<float> pcm;
            int rate = 0;
            og.push_back(LoadPcm(o.wav, false, pcm, rate) ? GapMs(pcm, rate) : NAN);
            mg.push_back(LoadPcm(m.capture, true, pcm, rate) ? GapMs(pcm, rate) : NAN);
        }
        AddRow(std::string("silence between two songs, ") + p.name, "ms", og, mg);
    }
}

void PlayingCpu(Ours &o, Mpd &m, const Songs &s)
{
    double warm = 3, window = g_quick ? 8 : 30;
    Progress("CPU while playing mp3 (%.0f s window, both daemons at once)", window);
    o.Text(ACT_STOP, "");
    o.Text(ACT_QUEUE_CLEAR, "");
    o.AddSong(s.longMp3, 1);
    m.Fresh("stop");
    m.Fresh("clear");
    m.Fresh("add \"file://" + s.longMp3 + "\"");
    o.Text(ACT_PLAY_INDEX, "0");
    m.Fresh("play 0");
    std::this_thread::sleep_for(std::chrono::duration<double>(warm));
    pid_t pp = o.PlayerPid();
    if (pp <= 0)
        Die("mplayer-daemon is not running after play");
    ProcFigures p0 = ReadProc(pp), m0 = ReadProc(m.pid);
    std::this_thread::sleep_for(std::chrono::duration<double>(window));
    ProcFigures p1 = ReadProc(pp), m1 = ReadProc(m.pid);
    AddRow("CPU of the playing process per minute of mp3", "s", {(p1.cpuSec - p0.cpuSec) * 60 / window},
           {(m1.cpuSec - m0.cpuSec) * 60 / window});
    o.Text(ACT_STOP, "");
    m.Fresh("stop");
}

const char kSections[] = "roundtrip, rps, silent, idle, queue, start, gaps, cpu, renderer";

}  // namespace

int main(int argc, char **argv)
{
    for (int i = 1; i < argc; ++i) {
        if (strcmp(argv[i], "--quick") == 0) {
            g_quick = true;
        } else if (strcmp(argv[i], "--only") == 0 && i + 1 < argc) {
            std::istringstream list(argv[++i]);
            for (std::string section; std::getline(list, section, ',');)
                if (!section.empty())
                    g_only.push_back(section);
        } else {
            fprintf(stderr, "usage: %s [--quick] [--only SECTION[,SECTION...]]\n"
                            "sections: %s\n", argv[0], kSections);
            return 2;
        }
    }
    if (!getenv("TARN_IN_NETNS")) {
        fprintf(stderr, "compare: run me through bench/compare (it starts me in a private network namespace)\n");
        return 2;
    }
    signal(SIGPIPE, SIG_IGN);
    prctl(PR_SET_CHILD_SUBREAPER, 1);
    char tmpl[] = "/tmp/tarn-compare-XXXXXX";
    if (!mkdtemp(tmpl))
        Die("cannot create a temporary directory");
    std::string base = tmpl;
    double start = NowSec();
    Progress("working in %s (%s mode)", base.c_str(), g_quick ? "quick" : "full");
    Songs songs = MakeSongs(base);
    Ours ours;
    Mpd mpd;
    StartOurs(ours, base);
    StartMpd(mpd, base);
    int repeats = 3;

    if (Wanted("roundtrip"))
        RoundTrips(ours, mpd, repeats);
    if (Wanted("rps"))
        RequestsPerSecond(ours, mpd, repeats);
    if (Wanted("silent"))
        SilentClients(ours, mpd, repeats);
    if (Wanted("idle"))
        Idle(ours, mpd);
    if (Wanted("queue"))
        QueueRows(ours, mpd, songs, repeats);
    if (Wanted("start"))
        PlayStart(ours, mpd, songs, g_quick ? 3 : 5);
    if (Wanted("gaps"))
        Gaps(ours, mpd, songs, repeats);
    if (Wanted("cpu"))
        PlayingCpu(ours, mpd, songs);
    if (Wanted("renderer"))
        HungRenderer(ours, songs);

    StopOurs(ours);
    StopMpd(mpd);
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
    PrintTable();
    printf("\n%d rows measured in %.0f s; ratios above 1 mean tarnaudiod needs more (time, CPU, memory) "
           "or, for req/s, serves more.\n", static_cast<int>(g_rows.size()), NowSec() - start);
    Run("rm -rf '" + base + "'");
    return 0;
}
