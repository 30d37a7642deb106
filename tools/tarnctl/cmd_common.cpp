// tarnctl: the helpers the commands share, the status texts and the
// read-back of what a request did.
#include <sys/ioctl.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include "daemon/ctrl.h"
#include "daemon/tarn_types.h"
#include "platform/media_playlists.h"
#include "platform/tarn_env.h"
#include "tools/tarnctl/client.h"
#include "tools/tarnctl/library.h"
#include "tools/tarnctl/text.h"
#include "tools/tarnctl/commands.h"

namespace fs = std::filesystem;

namespace tarnctl {

volatile sig_atomic_t g_stop = 0;
volatile sig_atomic_t g_resized = 0;

int UsageError(const Command &c, const char *fmt, const char *arg)
{
    if (fmt) {
        fputs("tarnctl: ", stderr);
        fprintf(stderr, fmt, arg);
        fputc('\n', stderr);
    }
    fprintf(stderr, "usage: tarnctl %s%s%s\n", c.name, *c.args ? " " : "", c.args);
    return kExitUsage;
}

long long NowMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

void SleepMs(int ms)
{
    struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&ts, nullptr);
}

bool ParseInt(const std::string &s, long *out)
{
    if (s.empty())
        return false;
    char *end = nullptr;
    errno = 0;
    long v = strtol(s.c_str(), &end, 10);
    if (*end || errno)
        return false;
    *out = v;
    return true;
}

// Removes "--name VALUE" (or a bare "--name" when value is null) from args.
// -1 when the value is missing.
int TakeOption(Args &args, const char *name, std::string *value, bool *present)
{
    for (size_t i = 0; i < args.size(); ++i) {
        if (args[i] != name)
            continue;
        if (present)
            *present = true;
        if (value) {
            if (i + 1 >= args.size())
                return -1;
            *value = args[i + 1];
            args.erase(args.begin() + static_cast<long>(i), args.begin() + static_cast<long>(i) + 2);
        } else {
            args.erase(args.begin() + static_cast<long>(i));
        }
        return 0;
    }
    return 0;
}

bool HasOptionLeft(const Args &args, std::string *which)
{
    for (const std::string &a : args) {
        if (a.size() > 1 && a[0] == '-' && a[1] == '-') {
            *which = a;
            return true;
        }
    }
    return false;
}

int TerminalColumns()
{
    struct winsize ws;
    if (ioctl(STDOUT_FILENO, TIOCGWINSZ, &ws) == 0 && ws.ws_col > 0)
        return ws.ws_col;
    const char *c = getenv("COLUMNS");
    long n = 0;
    if (c && ParseInt(c, &n) && n > 0 && n < 10000)
        return static_cast<int>(n);
    return 80;
}

bool IsLocalPath(const std::string &uri)
{
    return !uri.empty() && !IsUrl(uri);
}

// A local file that is gone: why, else "".
std::string MissingFile(const std::string &uri)
{
    if (!IsLocalPath(uri))
        return std::string();
    std::string path = uri.compare(0, 7, "file://") == 0 ? uri.substr(7) : uri;
    if (access(path.c_str(), R_OK) != 0)
        return path + ": " + strerror(errno);
    return std::string();
}

std::string SongTitle(const Json::Value &song)
{
    return song.get("title", "").asString();
}

// ---- status texts --------------------------------------------------------

std::string Field(const Snapshot &s, const std::string &name, bool *known)
{
    *known = true;
    bool stream = !s.station.empty();
    if (name == "title")
        return stream ? s.streamTitle : SongTitle(s.song);
    if (name == "artist")
        return stream ? s.station : s.song.get("artist", "").asString();
    if (name == "album")
        return s.song.get("album", "").asString();
    if (name == "file")
        return s.uri.empty() ? s.song.get("res", "").asString() : s.uri;
    if (name == "position")
        return s.total > 0 ? std::to_string(s.current + 1) : "";
    if (name == "length")
        return std::to_string(s.total);
    if (name == "time")
        return ClockText(s.duration > 0 ? s.duration : JsonInt(s.song, "duration", -1));
    if (name == "elapsed")
        return ClockText(s.state == kStopped ? 0 : s.position);
    if (name == "percent")
        return std::to_string(s.duration > 0 && s.state != kStopped ? s.position * 100 / s.duration : 0);
    if (name == "state")
        return StateWord(s.state);
    if (name == "volume")
        return std::to_string(s.volume);
    if (name == "repeat")
        return RepeatWord(s.repeat);
    if (name == "shuffle")
        return s.shuffle ? "on" : "off";
    if (name == "mute")
        return s.muted ? "on" : "off";
    if (name == "error")
        return s.lastError;
    *known = false;
    return std::string();
}

extern const char kFormatFields[] =
    "%title% %artist% %album% %file% %position% %length% %time% %elapsed% %percent% %state% "
    "%volume% %repeat% %shuffle% %mute% %error%";

// Expands a --format text; -1 with *bad set for an unknown field.
int Expand(const Snapshot &s, const std::string &fmt, std::string *out, std::string *bad)
{
    out->clear();
    for (size_t i = 0; i < fmt.size(); ++i) {
        char c = fmt[i];
        if (c == '\\' && i + 1 < fmt.size()) {
            char n = fmt[++i];
            *out += n == 'n' ? '\n' : n == 't' ? '\t' : n;
            continue;
        }
        if (c == '%') {
            size_t end = fmt.find('%', i + 1);
            if (end == std::string::npos) {
                *bad = fmt.substr(i);
                return -1;
            }
            if (end == i + 1) {
                *out += '%';
                i = end;
                continue;
            }
            std::string name = fmt.substr(i + 1, end - i - 1);
            bool known = false;
            std::string v = Field(s, name, &known);
            if (!known) {
                *bad = "%" + name + "%";
                return -1;
            }
            *out += TextClean(v);
            i = end;
            continue;
        }
        *out += c;
    }
    return 0;
}

void PrintStatus(const Snapshot &s)
{
    if (!s.selected) {
        printf("no player: the selected renderer is gone; 'tarnctl select local' plays here again\n");
        return;
    }
    int cols = TerminalColumns();
    bool known;
    if (s.state != kStopped) {
        std::string title = Field(s, "title", &known), artist = Field(s, "artist", &known);
        if (title.empty())
            title = s.uri;
        printf("%s\n", TextCut(artist.empty() ? title : artist + " - " + title, cols).c_str());
        std::string pos = s.total > 0 ? "#" + std::to_string(s.current + 1) + "/" + std::to_string(s.total) : "";
        int pct = s.duration > 0 ? s.position * 100 / s.duration : 0;
        printf("[%s] %s   %s/%s (%d%%)\n", StateWord(s.state), pos.c_str(), ClockText(s.position).c_str(),
               ClockText(s.duration).c_str(), pct);
    } else if (s.total == 0) {
        printf("[stopped] the queue is empty\n");
    } else {
        printf("[stopped] #%d/%d\n", s.current + 1, s.total);
    }
    printf("volume: %d%%   mute: %s   repeat: %s   shuffle: %s%s%s\n", s.volume, s.muted ? "on" : "off",
           RepeatWord(s.repeat), s.shuffle ? "on" : "off", s.local ? "" : "   renderer: ",
           s.local ? "" : TextClean(s.renderer).c_str());
    if (!s.lastError.empty())
        printf("error: %s\n", TextCut(s.lastError, cols > 8 ? cols - 7 : cols).c_str());
}

// Prints the status after a playback command (nothing with --json).
int ShowAfter()
{
    if (g_json)
        return 0;
    Snapshot s;
    if (GetSnapshot(&s) != 0)
        return kExitFail;
    PrintStatus(s);
    return 0;
}

// ---- read-back -------------------------------------------------------------

// Polls the snapshot until done(s) says yes; false after ms.
bool WaitFor(const std::function<bool(const Snapshot &)> &done, int ms, Snapshot *last)
{
    long long end = NowMs() + ms;
    for (;;) {
        if (GetSnapshot(last, false) != 0)
            return false;
        if (done(*last))
            return true;
        if (NowMs() >= end)
            return false;
        SleepMs(100);
    }
}

// After a request that starts a song: it plays, or the error that stopped
// it is said. before: the error count before the request.
int CheckStarted(int errorsBefore, int expectIndex, const std::string &expectUri)
{
    Snapshot s;
    bool ok = WaitFor(
        [&](const Snapshot &x) {
            if (x.errorCount != errorsBefore && !x.lastError.empty())
                return true;
            if (x.state != kPlaying || (expectIndex >= 0 && x.current != expectIndex))
                return false;
            if (x.local && !expectUri.empty() && x.uri != expectUri)
                return false;  // the player still reports the song before
            // A file is under way once its length is known; a stream once
            // its first second has played (connecting may take a while).
            return !x.local || x.position > 0 || (x.duration > 0 && !IsUrl(x.uri));
        },
        10000, &s);
    if (s.errorCount != errorsBefore && !s.lastError.empty())
        return Fail("%s", s.lastError.c_str());
    if (!ok && s.state != kPlaying)
        return Fail("playback did not start (the player is %s)", StateWord(s.state));
    return ShowAfter();
}

}  // namespace tarnctl
