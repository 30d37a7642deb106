// tarnctl: command-line client of tarnaudiod.
//
// One control request per action through the shared client calls; every
// failure is said on stderr with exit status 1 (checked before sending where
// it can be, read back afterwards where the reply cannot tell), usage
// mistakes print the one usage line of the command with exit status 2.
// Queue positions are 1-based for people; --json shows the daemon's replies
// with its own numbers.
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
#include "platform/tarn_version.h"
#include "tools/tarnctl/client.h"
#include "tools/tarnctl/library.h"
#include "tools/tarnctl/text.h"


namespace fs = std::filesystem;

namespace {

using Args = std::vector<std::string>;

struct Command {
    const char *name;
    const char *args;     // the usage line after "tarnctl NAME"
    const char *summary;  // one line for the list
    const char *details;  // for "tarnctl help NAME"
    int (*run)(const Command &, Args &);
};

const int kSlotMax = 9;
volatile sig_atomic_t g_stop = 0;
volatile sig_atomic_t g_resized = 0;

int UsageError(const Command &c, const char *fmt = nullptr, const char *arg = "")
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
int TakeOption(Args &args, const char *name, std::string *value, bool *present = nullptr)
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

const char kFormatFields[] =
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

// ---- playback --------------------------------------------------------------

// A song that was just started plays once the player program has connected
// back to the daemon; commands sent before then have nowhere to go. Waits
// (at most 3 s) until it has. 0, or 1 after saying why not.
int Settle(Snapshot *s, bool withSong = false)
{
    if (GetSnapshot(s, withSong) != 0)
        return kExitFail;
    if (!s->local || s->state != kPlaying || s->playerRunning)
        return 0;
    WaitFor([](const Snapshot &x) { return x.state != kPlaying || x.playerRunning; }, 3000, s);
    return GetSnapshot(s, withSong);
}

int NeedQueue(const Snapshot &s)
{
    if (s.total == 0)
        return Fail("the queue is empty; add songs first (tarnctl add, search --add, load)");
    return 0;
}

int CheckIndex(const Snapshot &s, long pos)
{
    if (NeedQueue(s) != 0)
        return kExitFail;
    if (pos < 1 || pos > s.total)
        return Fail("there is no song %ld: the queue has %d song%s (1 to %d)", pos, s.total,
                    s.total == 1 ? "" : "s", s.total);
    return 0;
}

// Checks that song index can be played; its URI in *uri.
int StartCurrent(int index, std::string *uri)
{
    Json::Value entry;
    if (GetEntry(index, &entry) != 0)
        return kExitFail;
    *uri = entry.get("res", "").asString();
    std::string missing = MissingFile(*uri);
    if (!missing.empty())
        return Fail("cannot play song %d: %s", index + 1, missing.c_str());
    return 0;
}

int CmdPlay(const Command &c, Args &a)
{
    if (a.size() > 1)
        return UsageError(c, "too many arguments");
    Snapshot s;
    if (GetSnapshot(&s) != 0)
        return kExitFail;
    if (!s.selected)
        return Fail("no player is selected (the renderer is gone); 'tarnctl select local' plays here");
    if (a.size() == 1) {
        long pos = 0;
        if (!ParseInt(a[0], &pos))
            return UsageError(c, "'%s' is not a queue position", a[0].c_str());
        std::string uri;
        if (CheckIndex(s, pos) != 0 || StartCurrent(static_cast<int>(pos - 1), &uri) != 0)
            return kExitFail;
        if (Request(ACT_PLAY_INDEX, std::to_string(pos - 1), nullptr, true) != 0)
            return kExitFail;
        return CheckStarted(s.errorCount, static_cast<int>(pos - 1), uri);
    }
    if (s.state == kPlaying)
        return ShowAfter();
    std::string uri;
    if (s.state == kStopped && (NeedQueue(s) != 0 || StartCurrent(s.current, &uri) != 0))
        return kExitFail;
    if (Request(ACT_PLAY_PAUSE, "", nullptr, true) != 0)
        return kExitFail;
    return CheckStarted(s.errorCount, -1, uri);
}

int CmdPause(const Command &c, Args &a)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    Snapshot s;
    if (Settle(&s) != 0)
        return kExitFail;
    if (s.state != kPlaying)
        return ShowAfter();
    if (Request(ACT_PLAY_PAUSE, "", nullptr, true) != 0)
        return kExitFail;
    if (!WaitFor([](const Snapshot &x) { return x.state != kPlaying; }, 2000, &s))
        return Fail("the player did not pause");
    return ShowAfter();
}

int CmdToggle(const Command &c, Args &a)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    return s.state == kPlaying ? CmdPause(c, a) : CmdPlay(c, a);
}

int CmdStop(const Command &c, Args &a)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    Snapshot s;
    if (Settle(&s) != 0)
        return kExitFail;
    if (Request(ACT_STOP, "", nullptr, true) != 0)
        return kExitFail;
    if (!WaitFor([](const Snapshot &x) { return x.state == kStopped; }, 2000, &s))
        return Fail("the player did not stop (it is %s)", StateWord(s.state));
    return ShowAfter();
}

int Step(const Command &c, Args &a, bool forward)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    Snapshot s;
    if (Settle(&s) != 0 || NeedQueue(s) != 0)
        return kExitFail;
    bool wrap = s.repeat == 3;
    if (forward && !wrap && s.orderIndex + 1 >= s.total)
        return Fail("song %d is the last of the queue (repeat is off)", s.current + 1);
    if (!forward && !wrap && s.orderIndex == 0)
        return Fail("song %d is the first of the queue", s.current + 1);
    if (s.state == kStopped) {
        // Nothing plays: the neighbour becomes the current song.
        int target = s.current + (forward ? 1 : -1);
        if (target >= s.total)
            target = 0;
        if (target < 0)
            target = s.total - 1;
        if (Request(ACT_QUEUE_SET_CURRENT, std::to_string(target), nullptr, true) != 0)
            return kExitFail;
        return ShowAfter();
    }
    int before = s.current;
    if (Request(forward ? ACT_NEXT : ACT_PREVIOUS, "", nullptr, true) != 0)
        return kExitFail;
    Snapshot after;
    WaitFor([&](const Snapshot &x) { return x.current != before || x.errorCount != s.errorCount; }, 2000,
            &after);
    Json::Value entry;
    if (GetEntry(after.current, &entry) != 0)
        return kExitFail;
    return CheckStarted(s.errorCount, after.current, entry.get("res", "").asString());
}

int CmdNext(const Command &c, Args &a) { return Step(c, a, true); }
int CmdPrev(const Command &c, Args &a) { return Step(c, a, false); }

// "[+-]SECONDS", "[+-]MM:SS", "[+-]H:MM:SS" or "PERCENT%". -1 when malformed.
int ParseSeek(const std::string &text, int position, int duration, int *target, std::string *why)
{
    std::string t = text;
    int sign = 0;
    if (!t.empty() && (t[0] == '+' || t[0] == '-')) {
        sign = t[0] == '+' ? 1 : -1;
        t = t.substr(1);
    }
    if (t.empty())
        return -1;
    if (t.back() == '%') {
        char *end = nullptr;
        double pct = strtod(t.c_str(), &end);
        if (end != t.c_str() + t.size() - 1 || pct < 0 || pct > 100 || sign)
            return -1;
        if (duration <= 0) {
            *why = "the length of this song is not known (a stream?)";
            return 1;
        }
        *target = static_cast<int>(duration * pct / 100.0);
        return 0;
    }
    long total = 0;
    size_t start = 0;
    int parts = 0;
    for (;;) {
        size_t colon = t.find(':', start);
        std::string part = t.substr(start, colon == std::string::npos ? std::string::npos : colon - start);
        long v = 0;
        if (part.empty() || part.find_first_not_of("0123456789") != std::string::npos || !ParseInt(part, &v))
            return -1;
        if (parts > 0 && v >= 60)
            return -1;
        total = total * 60 + v;
        if (++parts > 3 || total > INT_MAX / 60)
            return -1;
        if (colon == std::string::npos)
            break;
        start = colon + 1;
    }
    long want = sign ? position + sign * total : total;
    if (want < 0)
        want = 0;
    if (duration > 0 && want > duration) {
        if (!sign) {
            *why = "the song is only " + ClockText(duration) + " long";
            return 1;
        }
        want = duration;
    }
    *target = static_cast<int>(want);
    return 0;
}

int CmdSeek(const Command &c, Args &a)
{
    if (a.size() != 1)
        return UsageError(c, a.empty() ? "where to? give a time" : "too many arguments");
    Snapshot s;
    if (Settle(&s) != 0)
        return kExitFail;
    int target = 0;
    std::string why;
    int rc = ParseSeek(a[0], s.position, s.duration, &target, &why);
    if (rc < 0)
        return UsageError(c, "'%s' is not a time ([+-]SECONDS, [+-]MM:SS or PERCENT%%)", a[0].c_str());
    if (s.state == kStopped)
        return Fail("nothing is playing; seek works on the song that plays");
    if (rc > 0)
        return Fail("cannot seek: %s", why.c_str());
    if (s.duration <= 0)
        return Fail("cannot seek: the length of this song is not known (a stream?)");
    if (Request(ACT_SEEK, std::to_string(target), nullptr, true) != 0)
        return kExitFail;
    Snapshot after;
    if (!WaitFor([&](const Snapshot &x) { return x.position >= target - 2 && x.position <= target + 3; }, 2000,
                 &after))
        return Fail("the player did not seek (position %s, wanted %s)", ClockText(after.position).c_str(),
                    ClockText(target).c_str());
    return ShowAfter();
}

int CmdVolume(const Command &c, Args &a)
{
    if (a.size() > 1)
        return UsageError(c, "too many arguments");
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    if (a.empty()) {
        if (g_json)
            printf("%d\n", s.volume);
        else
            printf("volume: %d%%\n", s.volume);
        return 0;
    }
    long n = 0;
    bool relative = a[0][0] == '+' || a[0][0] == '-';
    if (!ParseInt(a[0], &n) || a[0].find_first_not_of("+-0123456789") != std::string::npos)
        return UsageError(c, "'%s' is not a volume", a[0].c_str());
    long want = relative ? s.volume + n : n;
    if (!relative && (want < 0 || want > 100))
        return Fail("volume %ld is out of range: 0 to 100", want);
    if (want < 0)
        want = 0;
    if (want > 100)
        want = 100;
    if (Request(ACT_SET_VOLUME, std::to_string(want), nullptr, true) != 0)
        return kExitFail;
    Snapshot after;
    if (!WaitFor([&](const Snapshot &x) { return x.volume == want; }, 2000, &after))
        return Fail("the volume did not change (it is %d%%)", after.volume);
    if (!g_json)
        printf("volume: %ld%%\n", want);
    return 0;
}

int CmdMute(const Command &c, Args &a)
{
    if (a.size() > 1)
        return UsageError(c, "too many arguments");
    Snapshot s;
    if (Settle(&s) != 0)
        return kExitFail;
    if (a.empty()) {
        printf("mute: %s\n", s.muted ? "on" : "off");
        return 0;
    }
    bool want;
    if (a[0] == "on")
        want = true;
    else if (a[0] == "off")
        want = false;
    else if (a[0] == "toggle")
        want = !s.muted;
    else
        return UsageError(c, "'%s': say on, off or toggle", a[0].c_str());
    if (want != s.muted) {
        if (!s.playerRunning)
            return Fail("nothing is playing; mute works while a song plays");
        if (Request(ACT_MUTE, "", nullptr, true) != 0)
            return kExitFail;
        Snapshot after;
        if (!WaitFor([&](const Snapshot &x) { return x.muted == want; }, 2000, &after))
            return Fail("the player did not %s", want ? "mute" : "unmute");
    }
    printf("mute: %s\n", want ? "on" : "off");
    return 0;
}

int CmdRepeat(const Command &c, Args &a)
{
    if (a.size() > 1)
        return UsageError(c, "too many arguments");
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    if (!a.empty()) {
        int mode = a[0] == "off" ? 1 : a[0] == "one" ? 2 : a[0] == "all" ? 3 : 0;
        if (!mode)
            return UsageError(c, "'%s': say off, one or all", a[0].c_str());
        if (mode != s.repeat) {
            if (Request(ACT_SET_REPEAT_MODE, std::to_string(mode), nullptr, true) != 0)
                return kExitFail;
            if (!WaitFor([&](const Snapshot &x) { return x.repeat == mode; }, 1000, &s))
                return Fail("the repeat mode did not change");
        }
    }
    printf("repeat: %s   shuffle: %s\n", RepeatWord(s.repeat), s.shuffle ? "on" : "off");
    return 0;
}

int CmdShuffle(const Command &c, Args &a)
{
    if (a.size() > 1)
        return UsageError(c, "too many arguments");
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    if (!a.empty()) {
        bool want;
        if (a[0] == "on")
            want = true;
        else if (a[0] == "off")
            want = false;
        else if (a[0] == "toggle")
            want = !s.shuffle;
        else
            return UsageError(c, "'%s': say on, off or toggle", a[0].c_str());
        if (want != s.shuffle) {
            if (Request(ACT_TOGGLE_SHUFFLE, "", nullptr, true) != 0)
                return kExitFail;
            if (!WaitFor([&](const Snapshot &x) { return x.shuffle == want; }, 1000, &s))
                return Fail("shuffle did not change");
        }
    }
    printf("shuffle: %s   repeat: %s\n", s.shuffle ? "on" : "off", RepeatWord(s.repeat));
    return 0;
}

int WithFormat(const Command &c, Args &a, bool currentOnly)
{
    std::string fmt;
    bool hasFormat = false;
    if (TakeOption(a, "--format", &fmt, &hasFormat) != 0)
        return UsageError(c, "--format needs a text");
    if (!a.empty())
        return UsageError(c, "unexpected '%s'", a[0].c_str());
    Snapshot s;
    if (GetSnapshot(&s) != 0)
        return kExitFail;
    if (g_json) {
        Json::StreamWriterBuilder w;
        printf("%s\n", Json::writeString(w, s.status).c_str());
        return 0;
    }
    if (hasFormat) {
        std::string out, bad;
        if (Expand(s, fmt, &out, &bad) != 0)
            return UsageError(c, "unknown field %s in the format", bad.c_str());
        if (!currentOnly || s.state != kStopped)
            printf("%s\n", out.c_str());
        return 0;
    }
    if (currentOnly) {
        if (s.state == kStopped)
            return 0;
        bool known;
        std::string title = Field(s, "title", &known), artist = Field(s, "artist", &known);
        if (title.empty())
            title = s.uri;
        printf("%s\n", TextClean(artist.empty() ? title : artist + " - " + title).c_str());
        return 0;
    }
    PrintStatus(s);
    return 0;
}

int CmdStatus(const Command &c, Args &a) { return WithFormat(c, a, false); }
int CmdCurrent(const Command &c, Args &a) { return WithFormat(c, a, true); }

int CmdEq(const Command &c, Args &a)
{
    if (a.size() != 10)
        return UsageError(c, "give exactly ten gains (dB)");
    float gains[10];
    for (int i = 0; i < 10; ++i) {
        char *end = nullptr;
        gains[i] = strtof(a[static_cast<size_t>(i)].c_str(), &end);
        if (!end || *end)
            return UsageError(c, "'%s' is not a number", a[static_cast<size_t>(i)].c_str());
        if (gains[i] < -24 || gains[i] > 12)
            return Fail("gain %s is out of range: -24 to 12 dB", a[static_cast<size_t>(i)].c_str());
    }
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    if (!s.local)
        return Fail("the equalizer works on the local output only (a renderer is selected)");
    char text[CTRL_PARAM_SIZE];
    CtrlFormatEqualizer(gains, text, sizeof(text));
    if (!s.playerRunning)
        Warn("nothing is playing: the gains apply to the song that plays now only; "
             "a new song starts with the stored equalizer");
    return Request(ACT_SET_EQUALIZER, text, nullptr, true);
}

// ---- queue -------------------------------------------------------------------

int FetchQueue(Json::Value *items, Json::Value *head)
{
    *items = Json::Value(Json::arrayValue);
    int page = 32;
    for (int start = 0;;) {
        Json::Value v;
        std::string text;
        char param[64];
        snprintf(param, sizeof(param), "%d %d", start, page);
        if (Send(MakeRequest(ACT_QUEUE_LIST, param), &text) != 0)
            return kExitFail;
        Json::CharReaderBuilder b;
        std::string errs;
        std::unique_ptr<Json::CharReader> reader(b.newCharReader());
        if (!reader->parse(text.data(), text.data() + text.size(), &v, &errs) || !v.isObject()) {
            if (page > 1 && text.size() >= CTRL_REPLY_SIZE - 1) {
                page /= 2;  // a page of long entries was cut: ask fewer
                continue;
            }
            return Fail("unexpected reply to the queue listing");
        }
        *head = v;
        for (const Json::Value &u : v["uris"])
            items->append(u);
        int total = JsonInt(v, "total");
        if (v["uris"].empty() || static_cast<int>(items->size()) >= total)
            break;
        start = static_cast<int>(items->size());
    }
    return 0;
}

void PrintSongTable(const std::vector<Json::Value> &songs, int markIndex, bool numbered)
{
    int cols = TerminalColumns();
    int digits = static_cast<int>(std::to_string(songs.size()).size());
    int fixed = 2 + (numbered ? digits + 2 : 0) + 8;  // marker, number, time
    int room = cols - fixed - 2;
    if (room < 20)
        room = 20;
    int titleW = room * 55 / 100, artistW = room - titleW;
    int n = 0;
    for (const Json::Value &u : songs) {
        ++n;
        std::string line = (n - 1 == markIndex) ? "> " : "  ";
        if (numbered)
            line += TextFit(std::to_string(n), digits, true) + "  ";
        std::string title = u.get("title", "").asString();
        line += TextFit(title, titleW) + " " + TextFit(u.get("artist", "").asString(), artistW) + " " +
                TextFit(ClockText(JsonInt(u, "duration", 0)), 7, true);
        printf("%s\n", line.c_str());
    }
}

int QueueList(const Command &c, Args &a)
{
    if (!a.empty())
        return UsageError(c, "unexpected '%s'", a[0].c_str());
    Json::Value items, head;
    if (FetchQueue(&items, &head) != 0)
        return kExitFail;
    if (g_json) {
        Json::Value all = head;
        all["uris"] = items;
        Json::StreamWriterBuilder w;
        printf("%s\n", Json::writeString(w, all).c_str());
        return 0;
    }
    int total = JsonInt(head, "total");
    printf("%d song%s   repeat: %s   shuffle: %s\n", total, total == 1 ? "" : "s",
           RepeatWord(RepeatMode(head.get("mode", "").asString())),
           head.get("shuffle", false).asBool() ? "on" : "off");
    std::vector<Json::Value> songs(items.begin(), items.end());
    PrintSongTable(songs, total ? JsonInt(head, "current") : -1, true);
    return 0;
}

// Adds records to the queue; says how many. 0 or 1.
int AddRecords(const std::vector<std::unique_ptr<TARN_MEDIA_INFO>> &songs)
{
    Snapshot before;
    if (GetSnapshot(&before, false) != 0)
        return kExitFail;
    size_t done = 0;
    for (const std::unique_ptr<TARN_MEDIA_INFO> &info : songs) {
        ControlRequest r = MakeRequest(ACT_QUEUE_ADD);
        memcpy(r.parameter, info.get(), sizeof(*info));
        std::string text;
        if (Send(r, &text) != 0)
            return Fail("added %zu of %zu songs", done, songs.size());
        Json::Value v;
        Json::CharReaderBuilder b;
        std::string errs;
        std::unique_ptr<Json::CharReader> reader(b.newCharReader());
        if (reader->parse(text.data(), text.data() + text.size(), &v, &errs) && v.isObject() &&
            v["error"].isString())
            return Fail("added %zu of %zu songs: %s", done, songs.size(), v["error"].asCString());
        ++done;
    }
    Snapshot after;
    if (GetSnapshot(&after, false) != 0)
        return kExitFail;
    if (after.total != before.total + static_cast<int>(done))
        return Fail("the queue has %d songs, expected %d after adding %zu", after.total,
                    before.total + static_cast<int>(done), done);
    if (!g_json)
        printf("added %zu song%s (the queue has %d)\n", done, done == 1 ? "" : "s", after.total);
    return 0;
}

int AddArgs(const Args &args)
{
    std::vector<std::unique_ptr<TARN_MEDIA_INFO>> songs;
    std::vector<std::string> problems, warnings;
    SongsForArgs(args, &songs, &problems, &warnings);
    for (const std::string &w : warnings)
        Warn("%s", TextClean(w).c_str());
    if (!problems.empty()) {
        for (const std::string &p : problems)
            Warn("%s", TextClean(p).c_str());
        return Fail("nothing added");
    }
    return AddRecords(songs);
}

int CmdAdd(const Command &c, Args &a)
{
    if (a.empty())
        return UsageError(c, "what to add? give files, folders, playlists or URLs");
    return AddArgs(a);
}

int CmdInsert(const Command &c, Args &a)
{
    long pos = 0;
    if (a.size() != 2 || !ParseInt(a[0], &pos))
        return UsageError(c);
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    if (pos < 1 || pos > s.total + 1)
        return Fail("cannot insert at %ld: positions are 1 to %d", pos, s.total + 1);
    std::vector<std::unique_ptr<TARN_MEDIA_INFO>> songs;
    std::vector<std::string> problems, warnings;
    SongsForArgs({a[1]}, &songs, &problems, &warnings);
    if (!problems.empty())
        return Fail("%s", TextClean(problems[0]).c_str());
    if (songs.size() != 1)
        return Fail("insert takes one song (%s gives %zu); use add for several", a[1].c_str(), songs.size());
    if (pos == s.total + 1)
        return AddRecords(songs);
    ControlRequest r = MakeRequest(ACT_QUEUE_INSERT);
    memcpy(r.parameter, songs[0].get(), sizeof(TARN_MEDIA_INFO));
    int32_t at = static_cast<int32_t>(pos - 1);
    memcpy(reinterpret_cast<char *>(&r) + CTRL_INSERT_POS_OFFSET, &at, sizeof(at));
    std::string text;
    if (Send(r, &text) != 0)
        return kExitFail;
    Snapshot after;
    if (!WaitFor([&](const Snapshot &x) { return x.total == s.total + 1; }, 1000, &after))
        return Fail("the song was not inserted (the queue has %d songs)", after.total);
    if (!g_json)
        printf("inserted %s as song %ld\n", TextClean(songs[0]->title[0] ? songs[0]->title : songs[0]->path).c_str(),
               pos);
    return 0;
}

int CmdDel(const Command &c, Args &a)
{
    if (a.empty())
        return UsageError(c);
    Snapshot s;
    if (GetSnapshot(&s, false) != 0)
        return kExitFail;
    std::vector<long> pos;
    for (const std::string &x : a) {
        long p = 0;
        if (!ParseInt(x, &p))
            return UsageError(c, "'%s' is not a queue position", x.c_str());
        if (CheckIndex(s, p) != 0)
            return kExitFail;
        pos.push_back(p);
    }
    std::sort(pos.begin(), pos.end());
    pos.erase(std::unique(pos.begin(), pos.end()), pos.end());
    for (auto it = pos.rbegin(); it != pos.rend(); ++it) {
        if (Request(ACT_QUEUE_REMOVE, std::to_string(*it - 1), nullptr, true) != 0)
            return kExitFail;
    }
    Snapshot after;
    int want = s.total - static_cast<int>(pos.size());
    if (!WaitFor([&](const Snapshot &x) { return x.total == want; }, 1000, &after))
        return Fail("the queue has %d songs, expected %d", after.total, want);
    if (!g_json)
        printf("removed %zu song%s (the queue has %d)\n", pos.size(), pos.size() == 1 ? "" : "s", after.total);
    return 0;
}

int CmdClear(const Command &c, Args &a)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    if (Request(ACT_QUEUE_CLEAR, "", nullptr, true) != 0)
        return kExitFail;
    Snapshot after;
    if (!WaitFor([](const Snapshot &x) { return x.total == 0; }, 1000, &after))
        return Fail("the queue was not cleared (%d songs)", after.total);
    return 0;
}

int CmdQueue(const Command &c, Args &a)
{
    std::string ignored;
    TakeOption(a, "--page", &ignored);  // pages are sized by the reply now
    if (a.empty() || a[0] == "list") {
        if (!a.empty())
            a.erase(a.begin());
        return QueueList(c, a);
    }
    std::string sub = a[0];
    a.erase(a.begin());
    static const Command kAdd = {"queue add", "FILE|FOLDER|M3U|URL...", "", "", nullptr};
    static const Command kInsert = {"queue insert", "POS FILE|URL", "", "", nullptr};
    static const Command kRemove = {"queue remove", "POS...", "", "", nullptr};
    static const Command kClear = {"queue clear", "", "", "", nullptr};
    static const Command kCurrent = {"queue current", "POS", "", "", nullptr};
    if (sub == "add")
        return CmdAdd(kAdd, a);
    if (sub == "insert")
        return CmdInsert(kInsert, a);
    if (sub == "remove" || sub == "del")
        return CmdDel(kRemove, a);
    if (sub == "clear")
        return CmdClear(kClear, a);
    if (sub == "current") {
        long pos = 0;
        if (a.size() != 1 || !ParseInt(a[0], &pos))
            return UsageError(kCurrent);
        Snapshot s;
        if (GetSnapshot(&s, false) != 0 || CheckIndex(s, pos) != 0)
            return kExitFail;
        if (Request(ACT_QUEUE_SET_CURRENT, std::to_string(pos - 1), nullptr, true) != 0)
            return kExitFail;
        Snapshot after;
        if (!WaitFor([&](const Snapshot &x) { return x.current == pos - 1; }, 1000, &after))
            return Fail("song %ld did not become the current one", pos);
        return 0;
    }
    return UsageError(c, "unknown queue command '%s'", sub.c_str());
}

// ---- library -------------------------------------------------------------------

Json::Value SongJson(const MediaSong &s)
{
    Json::Value v;
    v["title"] = s.title.empty() ? fs::path(s.path).filename().string() : s.title;
    v["artist"] = s.artist;
    v["album"] = s.album;
    v["duration"] = static_cast<int>(s.duration);
    v["res"] = s.path;
    v["item_id"] = s.id;
    return v;
}

int AddSongs(const std::vector<MediaSong> &found)
{
    std::vector<std::unique_ptr<TARN_MEDIA_INFO>> songs;
    for (const MediaSong &s : found) {
        std::unique_ptr<TARN_MEDIA_INFO> info(new TARN_MEDIA_INFO());
        MediaSongToInfo(s, info.get());
        songs.push_back(std::move(info));
    }
    return AddRecords(songs);
}

int PrintSongs(const std::vector<MediaSong> &found)
{
    if (g_json) {
        Json::Value arr(Json::arrayValue);
        for (const MediaSong &s : found)
            arr.append(SongJson(s));
        Json::StreamWriterBuilder w;
        printf("%s\n", Json::writeString(w, arr).c_str());
        return 0;
    }
    std::vector<Json::Value> rows;
    for (const MediaSong &s : found)
        rows.push_back(SongJson(s));
    PrintSongTable(rows, -1, false);
    return 0;
}

int CmdSearch(const Command &c, Args &a)
{
    bool add = false;
    TakeOption(a, "--add", nullptr, &add);
    std::string field = "any";
    if (!a.empty() && (a[0] == "any" || a[0] == "artist" || a[0] == "album" || a[0] == "title")) {
        field = a[0];
        a.erase(a.begin());
    }
    if (a.empty())
        return UsageError(c, "search for what? give words");
    std::vector<MediaSong> found;
    std::string why;
    if (LibrarySearch(field, a, &found, &why) != 0)
        return Fail("%s", why.c_str());
    if (found.empty())
        return Fail("no songs of the library match");
    return add ? AddSongs(found) : PrintSongs(found);
}

int CmdLs(const Command &c, Args &a)
{
    bool add = false;
    TakeOption(a, "--add", nullptr, &add);
    if (a.size() > 1)
        return UsageError(c, "give one folder");
    std::string why;
    MediaLib *lib = LibraryOpen(&why);
    if (!lib)
        return Fail("%s", why.c_str());
    std::vector<MediaSong> all;
    if (lib->ListSongs(&all) != 0)
        return Fail("%s", lib->LastError().c_str());
    if (all.empty())
        return Fail("the media library holds no songs (run \"tarnlib scan DIR\")");
    std::string root = LibraryRoot(all);
    std::string dir = root;
    if (!a.empty()) {
        std::string p = a[0];
        while (p.size() > 1 && p.back() == '/')
            p.pop_back();
        dir = p[0] == '/' ? p : (root == "/" ? "/" + p : root + "/" + p);
        dir = fs::path(dir).lexically_normal().string();
        while (dir.size() > 1 && dir.back() == '/')
            dir.pop_back();
    }
    std::string prefix = dir == "/" ? "/" : dir + "/";
    std::vector<MediaSong> below;
    std::vector<std::string> folders;
    std::vector<MediaSong> here;
    for (const MediaSong &s : all) {
        if (s.path.compare(0, prefix.size(), prefix) != 0)
            continue;
        below.push_back(s);
        std::string rest = s.path.substr(prefix.size());
        size_t slash = rest.find('/');
        if (slash == std::string::npos)
            here.push_back(s);
        else if (folders.empty() || folders.back() != rest.substr(0, slash))
            folders.push_back(rest.substr(0, slash));
    }
    if (below.empty())
        return Fail("no songs of the library in %s", dir.c_str());
    std::sort(below.begin(), below.end(), [](const MediaSong &x, const MediaSong &y) { return x.path < y.path; });
    if (add)
        return AddSongs(below);
    std::sort(folders.begin(), folders.end());
    folders.erase(std::unique(folders.begin(), folders.end()), folders.end());
    std::sort(here.begin(), here.end(), [](const MediaSong &x, const MediaSong &y) { return x.path < y.path; });
    std::string shown = dir == root ? "" : dir.substr(root == "/" ? 1 : root.size() + 1) + "/";
    int cols = TerminalColumns();
    for (const std::string &f : folders)
        printf("%s\n", TextCut(shown + f + "/", cols).c_str());
    for (const MediaSong &s : here)
        printf("%s\n", TextCut(shown + fs::path(s.path).filename().string(), cols).c_str());
    return 0;
}

int CmdPlaylists(const Command &c, Args &a)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    std::string why;
    std::vector<NamedPlaylist> lists = AllPlaylists(&why);
    if (lists.empty() && !why.empty() && !LibraryOpen(nullptr))
        return Fail("%s", why.c_str());
    int cols = TerminalColumns();
    int w = 0;
    for (const NamedPlaylist &p : lists)
        w = std::max(w, TextWidth(p.name));
    w = std::min(w, cols / 2);
    for (const NamedPlaylist &p : lists)
        printf("%s  %s\n", TextFit(p.name, w).c_str(), TextCut(p.path, cols - w - 2).c_str());
    return 0;
}

int CmdLoad(const Command &c, Args &a)
{
    if (a.size() != 1)
        return UsageError(c);
    std::string why;
    std::vector<NamedPlaylist> lists = AllPlaylists(&why);
    const NamedPlaylist *hit = nullptr;
    std::string want = TextFold(a[0]);
    for (const NamedPlaylist &p : lists) {
        if (TextFold(p.name) == want || TextFold(fs::path(p.path).stem().string()) == want || p.path == a[0]) {
            hit = &p;
            break;
        }
    }
    if (!hit)
        return Fail("no playlist named '%s' (see tarnctl playlists)", TextClean(a[0]).c_str());
    return AddArgs({hit->path});
}

int CmdSave(const Command &c, Args &a)
{
    if (a.size() != 1)
        return UsageError(c);
    const std::string &name = a[0];
    if (name.empty() || name[0] == '.' || name.find('/') != std::string::npos || TextClean(name) != name)
        return Fail("'%s' cannot be a playlist name (no '/', no leading '.')", TextClean(name).c_str());
    std::string why;
    std::string folder = PlaylistFolder(&why);
    if (folder.empty())
        return Fail("no playlist folder: %s", why.c_str());
    std::string path = folder + "/" + name + ".m3u";
    struct stat st;
    if (stat(path.c_str(), &st) == 0)
        return Fail("playlist '%s' exists already: %s", name.c_str(), path.c_str());
    Json::Value items, head;
    if (FetchQueue(&items, &head) != 0)
        return kExitFail;
    if (items.empty())
        return Fail("the queue is empty; nothing to save");
    std::error_code ec;
    fs::create_directories(folder, ec);
    if (ec)
        return Fail("cannot create the playlist folder %s: %s", folder.c_str(), ec.message().c_str());
    std::string tmp = path + ".tmp";
    {
        std::ofstream out(tmp, std::ios::trunc);
        out << "#EXTM3U\n#PLAYLIST:" << name << "\n";
        for (const Json::Value &u : items) {
            std::string artist = u.get("artist", "").asString(), title = u.get("title", "").asString();
            out << "#EXTINF:" << JsonInt(u, "duration", -1) << "," << (artist.empty() ? "" : artist + " - ")
                << title << "\n"
                << u.get("res", "").asString() << "\n";
        }
        out.flush();
        if (!out) {
            unlink(tmp.c_str());
            return Fail("cannot write %s: %s", tmp.c_str(), strerror(errno));
        }
    }
    if (rename(tmp.c_str(), path.c_str()) != 0) {
        int err = errno;
        unlink(tmp.c_str());
        return Fail("cannot write %s: %s", path.c_str(), strerror(err));
    }
    printf("saved %u song%s to %s\n", items.size(), items.size() == 1 ? "" : "s", path.c_str());
    return 0;
}

// ---- sources and slots -------------------------------------------------------

int SlotLoad(const Command &c, Args &a);

// A source change, read back through the changed flag that the daemon sets
// only when the change succeeded.
int SourceChange(int action, const std::string &param, const char *failure)
{
    const PublishedStatusShm *seg = AttachPublished(true);
    int wasChanged = seg ? seg->changed : 0;
    if (seg && wasChanged && Request(ACT_CLEAR_CHANGED, "", nullptr) != 0)
        return kExitFail;
    if (Request(action, param, nullptr, true) != 0)
        return kExitFail;
    if (!seg)
        return ShowAfter();
    bool ok = false;
    for (long long end = NowMs() + 1500; !ok && NowMs() < end;) {
        ok = const_cast<volatile const PublishedStatusShm *>(seg)->changed != 0;
        if (!ok)
            SleepMs(50);
    }
    shmdt(seg);
    if (!ok) {
        if (wasChanged)
            Request(ACT_SET_CHANGED, "", nullptr);
        return Fail("%s", failure);
    }
    return ShowAfter();
}

int CmdSource(const Command &c, Args &a)
{
    if (a.empty())
        return UsageError(c);
    const std::string &s = a[0];
    if (s == "custom") {
        static const Command kLoad = {"slot load", "N", "", "", nullptr};
        Args rest(a.begin() + 1, a.end());
        return SlotLoad(kLoad, rest);
    }
    if (a.size() != 1)
        return UsageError(c, "too many arguments");
    if (s == "random")
        return SourceChange(ACT_SOURCE_RANDOM, "", "no random selection: the media library holds no songs");
    if (s == "radio")
        return SourceChange(ACT_SOURCE_RADIO, "", "no station lists found (or they hold no stations)");
    if (s == "ipod")
        return SourceChange(ACT_SOURCE_IPOD, "", "no iPod track list found (is a portable player connected?)");
    if (s == "playlist")
        return SourceChange(ACT_SOURCE_PLAYLIST, "", "no saved playlist with playable songs in the media library");
    if (s == "next")
        return SourceChange(ACT_SOURCE_NEXT, "", "cannot move to the next source");
    if (s == "prev" || s == "previous")
        return SourceChange(ACT_SOURCE_PREVIOUS, "", "cannot move to the previous source");
    return UsageError(c, "unknown source '%s'", s.c_str());
}

int SlotNumber(const Command &c, Args &a, long *slot)
{
    if (a.size() != 1 || !ParseInt(a[0], slot))
        return UsageError(c);
    if (*slot < 1 || *slot > kSlotMax)
        return Fail("there is no custom slot %ld: slots are 1 to %d", *slot, kSlotMax);
    return 0;
}

int SlotLoad(const Command &c, Args &a)
{
    long slot = 0;
    if (int rc = SlotNumber(c, a, &slot))
        return rc;
    std::string type, second, third;
    if (TARNAudioCustomGet(static_cast<int>(slot), type, second, third) != 0)
        return Fail("custom slot %ld is empty", slot);
    if (type == "playlist" && access(second.c_str(), R_OK) != 0)
        return Fail("custom slot %ld names the playlist %s, which cannot be read: %s", slot, second.c_str(),
                    strerror(errno));
    std::string failure = "custom slot " + std::to_string(slot) + " (" + type + ") could not be loaded";
    return SourceChange(ACT_SOURCE_CUSTOM, std::to_string(slot), failure.c_str());
}

int SlotSave(const Command &c, Args &a)
{
    long slot = 0;
    if (int rc = SlotNumber(c, a, &slot))
        return rc;
    std::string file = TarnPath("/usr/tarn/etc/audio/custom_slots.json");
    struct stat before, after;
    bool had = stat(file.c_str(), &before) == 0;
    if (Request(ACT_SAVE_CUSTOM, std::to_string(slot), nullptr, true) != 0)
        return kExitFail;
    bool has = stat(file.c_str(), &after) == 0;
    bool stored = has && (!had || before.st_ino != after.st_ino ||
                          before.st_mtim.tv_sec != after.st_mtim.tv_sec ||
                          before.st_mtim.tv_nsec != after.st_mtim.tv_nsec);
    std::string type, second, third;
    if (!stored || TARNAudioCustomGet(static_cast<int>(slot), type, second, third) != 0)
        return Fail("the current source cannot be stored in a slot: only a saved playlist or a radio "
                    "station can be (choose one with 'tarnctl source playlist' or 'tarnctl source radio')");
    printf("custom slot %ld: %s %s\n", slot, type.c_str(), TextClean(third.empty() ? second : third).c_str());
    return 0;
}

int CmdSlot(const Command &c, Args &a)
{
    static const Command kSave = {"slot save", "N", "", "", nullptr};
    static const Command kLoad = {"slot load", "N", "", "", nullptr};
    if (a.empty())
        return UsageError(c);
    std::string sub = a[0];
    a.erase(a.begin());
    if (sub == "save")
        return SlotSave(kSave, a);
    if (sub == "load")
        return SlotLoad(kLoad, a);
    if (sub == "list" && a.empty()) {
        for (int i = 1; i <= kSlotMax; ++i) {
            std::string type, second, third;
            if (TARNAudioCustomGet(i, type, second, third) == 0)
                printf("%d  %s  %s\n", i, type.c_str(), TextClean(third.empty() ? second : third).c_str());
            else
                printf("%d  (empty)\n", i);
        }
        return 0;
    }
    return UsageError(c, "unknown slot command '%s'", sub.c_str());
}

// ---- players and network -------------------------------------------------------

int ListDevices(bool renderers, Json::Value *list)
{
    Json::Value v;
    if (Request(renderers ? ACT_LIST_RENDERERS : ACT_LIST_SERVERS, "0 100", &v) != 0)
        return kExitFail;
    *list = v;
    return 0;
}

int Devices(const Command &c, Args &a, bool renderers)
{
    if (!a.empty())
        return UsageError(c, "no arguments expected");
    Json::Value v;
    if (ListDevices(renderers, &v) != 0)
        return kExitFail;
    if (g_json) {
        Json::StreamWriterBuilder w;
        printf("%s\n", Json::writeString(w, v).c_str());
        return 0;
    }
    int cols = TerminalColumns();
    const Json::Value &list = v["list"];
    if (list.empty())
        printf("no %s found yet ('tarnctl discover %s' looks again)\n", renderers ? "renderers" : "media servers",
               renderers ? "renderers" : "servers");
    for (const Json::Value &d : list) {
        std::string addr = d.get("ip", "").asString() + ":" + d.get("port", "").asString();
        printf("%3d  %s %s\n", JsonInt(d, "index") + 1, TextFit(d.get("friendly_name", "").asString(), 32).c_str(),
               TextCut(addr, cols - 39).c_str());
    }
    return 0;
}

int CmdServers(const Command &c, Args &a) { return Devices(c, a, false); }
int CmdRenderers(const Command &c, Args &a) { return Devices(c, a, true); }

int CmdDiscover(const Command &c, Args &a)
{
    if (a.size() != 1 || (a[0] != "servers" && a[0] != "renderers"))
        return UsageError(c);
    return Request(a[0] == "servers" ? ACT_SEARCH_SERVERS : ACT_SEARCH_RENDERERS, "", nullptr, true);
}

int CmdSelect(const Command &c, Args &a)
{
    if (a.size() != 1)
        return UsageError(c);
    if (a[0] == "local")
        return Request(ACT_SELECT_PLAYER, "-1", nullptr, true);
    Json::Value v;
    if (ListDevices(true, &v) != 0)
        return kExitFail;
    int count = static_cast<int>(v["list"].size());
    long n = 0;
    int index = -1;
    if (ParseInt(a[0], &n)) {
        if (n < 1 || n > count)
            return Fail("there is no renderer %ld: %d renderer%s found (see tarnctl renderers)", n, count,
                        count == 1 ? "" : "s");
        index = JsonInt(v["list"][static_cast<int>(n - 1)], "index");
    } else {
        int matches = 0;
        std::string want = TextFold(a[0]);
        for (const Json::Value &d : v["list"]) {
            std::string name = TextFold(d.get("friendly_name", "").asString());
            if (name == want) {
                index = JsonInt(d, "index");
                matches = 1;
                break;
            }
            if (name.find(want) != std::string::npos) {
                index = JsonInt(d, "index");
                ++matches;
            }
        }
        if (matches == 0)
            return Fail("no renderer named '%s' (see tarnctl renderers)", TextClean(a[0]).c_str());
        if (matches > 1)
            return Fail("'%s' matches several renderers; give the full name or the number", TextClean(a[0]).c_str());
    }
    if (Request(ACT_SELECT_PLAYER, std::to_string(index), nullptr, true) != 0)
        return kExitFail;
    Json::Value after;
    if (ListDevices(true, &after) != 0)
        return kExitFail;
    if (JsonInt(after, "current", -1) != index)
        return Fail("renderer %d was not selected", index + 1);
    if (!g_json)
        printf("playing on renderer %d\n", index + 1);
    return 0;
}

int CmdChanged(const Command &c, Args &a)
{
    if (a.empty()) {
        const PublishedStatusShm *seg = AttachPublished();
        if (!seg)
            return kExitFail;
        printf("changed: %s\n", seg->changed ? "yes" : "no");
        shmdt(seg);
        return 0;
    }
    if (a.size() == 1 && a[0] == "set")
        return Request(ACT_SET_CHANGED, "", nullptr, true);
    if (a.size() == 1 && a[0] == "clear")
        return Request(ACT_CLEAR_CHANGED, "", nullptr, true);
    return UsageError(c);
}

// ---- waiting and watching ----------------------------------------------------

void OnSignal(int sig)
{
    if (sig == SIGWINCH)
        g_resized = 1;
    else
        g_stop = 1;
}

struct Seen {
    std::string uri, title;
    int state = 0, index = 0, volume = 0, changed = 0, shuffle = 0, repeat = 0;
};

Seen Look(const PublishedStatusShm *seg)
{
    PublishedStatusShm s;
    memcpy(&s, const_cast<const void *>(static_cast<const volatile void *>(seg)), sizeof(s));
    Seen o;
    o.uri.assign(s.currentUri, strnlen(s.currentUri, sizeof(s.currentUri)));
    o.title.assign(s.title, strnlen(s.title, sizeof(s.title)));
    o.state = s.state;
    o.index = s.index;
    o.volume = s.volume;
    o.changed = s.changed;
    o.shuffle = s.shuffle;
    o.repeat = s.repeatMode;
    return o;
}

int CmdWait(const Command &c, Args &a)
{
    std::string limit;
    if (TakeOption(a, "--timeout", &limit) != 0 || !a.empty())
        return UsageError(c);
    long seconds = 0;
    if (!limit.empty() && (!ParseInt(limit, &seconds) || seconds < 1))
        return UsageError(c, "--timeout takes whole seconds");
    if (!DaemonAlive())
        return Fail("tarnaudiod is not running");
    const PublishedStatusShm *seg = AttachPublished();
    if (!seg)
        return kExitFail;
    signal(SIGINT, OnSignal);
    signal(SIGTERM, OnSignal);
    Seen first = Look(seg);
    long long end = seconds ? NowMs() + seconds * 1000 : 0;
    int rc = kExitOk;
    for (int turn = 0;; ++turn) {
        SleepMs(100);
        Seen now = Look(seg);
        std::vector<const char *> what;
        if (now.state != first.state || now.uri != first.uri || now.index != first.index ||
            now.title != first.title)
            what.push_back("player");
        if (now.volume != first.volume)
            what.push_back("volume");
        if (now.shuffle != first.shuffle || now.repeat != first.repeat)
            what.push_back("options");
        if (now.changed != first.changed)
            what.push_back("changed");
        if (!what.empty()) {
            for (const char *w : what)
                printf("%s\n", w);
            break;
        }
        if (turn % 5 == 4 && !DaemonAlive()) {
            rc = Fail("tarnaudiod stopped");
            break;
        }
        if (g_stop) {
            rc = kExitFail;
            break;
        }
        if (end && NowMs() >= end) {
            rc = Fail("nothing changed within %ld s", seconds);
            break;
        }
    }
    shmdt(seg);
    return rc;
}

std::string WatchLine(const Seen &s, const PublishedStatusShm *seg, int total, int cols)
{
    PublishedStatusShm p;
    memcpy(&p, const_cast<const void *>(static_cast<const volatile void *>(seg)), sizeof(p));
    p.artist[sizeof(p.artist) - 1] = '\0';
    int state = s.state == PLAYER_STATE_PLAYING || s.state == PLAYER_STATE_TRANSITIONING ? kPlaying
                : s.state == PLAYER_STATE_PAUSED                                         ? kPaused
                                                                                         : kStopped;
    if (s.uri.empty())
        state = kStopped;
    std::string head = std::string(StateWord(state));
    head.resize(8, ' ');
    std::string times = state == kStopped ? "" : ClockText(p.position) + "/" + ClockText(p.duration) + " ";
    std::string where = total > 0 && !s.uri.empty() ? "#" + std::to_string(p.index + 1) + "/" + std::to_string(total) + " " : "";
    std::string flags = std::string("vol ") + std::to_string(p.volume) + "%" +
                        (p.repeatMode == 2 ? " repeat-one" : p.repeatMode == 3 ? " repeat-all" : "") +
                        (p.shuffle ? " shuffle" : "");
    std::string title = s.title.empty() ? s.uri : s.title;
    if (p.artist[0])
        title = std::string(p.artist) + " - " + title;
    // The bar takes what is left after the texts, between 0 and 30 columns.
    std::string fixed = head + times + where + flags + "  ";
    int room = cols - 1 - TextWidth(fixed) - 24;
    std::string bar;
    if (state != kStopped && room >= 8) {
        int w = std::min(room, 30) - 2;
        int filled = p.duration > 0 ? static_cast<int>(static_cast<long long>(p.position) * w / p.duration) : 0;
        filled = std::max(0, std::min(w, filled));
        bar = "[" + std::string(static_cast<size_t>(filled), '#') + std::string(static_cast<size_t>(w - filled), '-') + "] ";
    }
    std::string line = head + bar + times + where + flags + (state == kStopped && s.uri.empty() ? "" : "  " + title);
    return TextCut(line, cols - 1);
}

int CmdWatch(const Command &c, Args &a)
{
    std::string countText, intervalText;
    if (TakeOption(a, "--count", &countText) != 0 || TakeOption(a, "--interval", &intervalText) != 0 || !a.empty())
        return UsageError(c);
    long count = -1, interval = 500;
    if (!countText.empty() && (!ParseInt(countText, &count) || count < 1))
        return UsageError(c, "--count takes a number of lines");
    if (!intervalText.empty() && (!ParseInt(intervalText, &interval) || interval < 50))
        return UsageError(c, "--interval takes milliseconds (50 or more)");
    if (!DaemonAlive())
        return Fail("tarnaudiod is not running");
    const PublishedStatusShm *seg = AttachPublished();
    if (!seg)
        return kExitFail;
    signal(SIGINT, OnSignal);
    signal(SIGTERM, OnSignal);
    signal(SIGWINCH, OnSignal);
    bool tty = isatty(STDOUT_FILENO);
    int cols = TerminalColumns();
    int total = -1;
    Seen last;
    int rc = kExitOk;
    long long nextAlive = 0;
    for (long n = 0; !g_stop && (count < 0 || n < count); ++n) {
        if (NowMs() >= nextAlive) {
            nextAlive = NowMs() + 1000;
            if (!DaemonAlive()) {
                if (tty)
                    printf("\r\x1b[K");
                fflush(stdout);
                rc = Fail("tarnaudiod stopped; nothing more to watch");
                break;
            }
        }
        if (g_resized) {
            g_resized = 0;
            cols = TerminalColumns();
        }
        Seen s = Look(seg);
        if (total < 0 || s.changed != last.changed || s.index != last.index || s.uri != last.uri) {
            // The queue's length, for "#3/12"; a page of one entry is enough.
            Json::Value q;
            if (Request(ACT_QUEUE_LIST, "0 1", &q) == 0)
                total = JsonInt(q, "total");
            last = s;
        }
        std::string line = WatchLine(s, seg, total, cols);
        if (tty)
            printf("\r%s\x1b[K", line.c_str());
        else
            printf("%s\n", line.c_str());
        fflush(stdout);
        if (count >= 0 && n + 1 >= count)
            break;
        SleepMs(static_cast<int>(interval));
    }
    if (tty && rc == kExitOk)
        printf("\n");
    shmdt(seg);
    return rc;
}

// ---- help --------------------------------------------------------------------

int CmdHelp(const Command &c, Args &a);

const Command kCommands[] = {
    {"status", "[--format FORMAT]", "what plays, where in the song, volume, modes, last error",
     "Shows the current song, the state (stopped, playing, paused), the queue position, the time,\n"
     "volume, mute, repeat and shuffle, and the last playback error. --format prints only the\n"
     "text given, with these fields filled in:\n  " /* fields */ "%title% %artist% %album% %file% %position% "
     "%length% %time% %elapsed%\n  %percent% %state% %volume% %repeat% %shuffle% %mute% %error%\n"
     "(\\n and \\t are a line end and a tab; %% is a percent sign). Example:\n"
     "  tarnctl status --format '%state% %artist% - %title% [%elapsed%/%time%]'",
     CmdStatus},
    {"current", "[--format FORMAT]", "the song that plays (nothing when stopped)",
     "Prints \"Artist - Title\" of the song that plays or is paused, nothing when stopped.\n"
     "--format takes the fields of 'tarnctl help status'.",
     CmdCurrent},
    {"play", "[POS]", "start or resume; play song POS of the queue",
     "Starts the current song, resumes a paused one, or plays song POS (1 is the first).\n"
     "Never pauses. Fails when the queue is empty, POS is not in it, the song's file is gone,\n"
     "or the player reports that it cannot play the song.",
     CmdPlay},
    {"pause", "", "pause (nothing when not playing)", "Pauses the song that plays; does nothing otherwise.", CmdPause},
    {"toggle", "", "pause when playing, else play", "Pauses when playing, else starts or resumes.", CmdToggle},
    {"stop", "", "stop playback", "Stops playback.", CmdStop},
    {"next", "", "the next song", "Plays the next song; when stopped, makes it the current one.", CmdNext},
    {"prev", "", "the previous song", "Plays the previous song; when stopped, makes it the current one.", CmdPrev},
    {"seek", "[+-]SECONDS|[+-]MM:SS|PERCENT%", "jump within the song",
     "Jumps to a time in the song that plays: 90, 1:30 and 1:02:03 are absolute; +10 and -0:15\n"
     "are relative to where it is; 50% is the middle.",
     CmdSeek},
    {"volume", "[[+-]N]", "show or set the volume (0-100), or change it by N",
     "Without N shows the volume; N sets it (0 to 100); +N and -N change it.", CmdVolume},
    {"mute", "[on|off|toggle]", "show or set muting", "Shows or sets muting of the song that plays.", CmdMute},
    {"repeat", "[off|one|all]", "show or set the repeat mode",
     "off: stop after the last song; one: repeat the song; all: repeat the queue.\n"
     "Repeat one and shuffle never stand together: choosing one turns shuffle off.",
     CmdRepeat},
    {"shuffle", "[on|off|toggle]", "show or set shuffle", "Shows or sets shuffle (turning it on ends repeat one).",
     CmdShuffle},
    {"eq", "G1 G2 G3 G4 G5 G6 G7 G8 G9 G10", "ten equalizer gains in dB (-24 to 12)",
     "Sends ten gains (about 29 Hz to 15 kHz) to the local player, e.g.\n  tarnctl eq 0 0 1.5 3 0 0 0 -2 0 0",
     CmdEq},
    {"queue", "[list | add ... | insert POS FILE | remove POS... | clear | current POS]", "show or edit the queue",
     "Without arguments lists the queue (1 is the first song, > marks the current one).\n"
     "  queue add FILE|FOLDER|M3U|URL...   as tarnctl add\n"
     "  queue insert POS FILE|URL          insert before song POS (POS = length+1 appends)\n"
     "  queue remove POS...                remove songs (also: tarnctl del)\n"
     "  queue clear                        empty the queue (also: tarnctl clear)\n"
     "  queue current POS                  make song POS the current one without playing it",
     CmdQueue},
    {"add", "FILE|FOLDER|M3U|URL...", "append songs: files, folders (recursive), playlists, URLs",
     "Appends songs to the queue. A folder adds every playable song below it in path order;\n"
     "an .m3u/.m3u8 file adds its entries; a URL (http://...) is added as a stream. Each song\n"
     "gets its title, artist, album, duration and library id from the media library, or from\n"
     "the file's own tags when the library does not know it. When any argument gives nothing\n"
     "(missing, not playable, empty folder) nothing is added.",
     CmdAdd},
    {"insert", "POS FILE|URL", "insert a song before song POS", "Inserts one song before song POS.", CmdInsert},
    {"del", "POS...", "remove songs from the queue", "Removes the songs at the positions given.", CmdDel},
    {"clear", "", "empty the queue", "Removes every song from the queue.", CmdClear},
    {"search", "[any|artist|album|title] WORDS... [--add]", "find songs in the media library",
     "Lists the library's songs whose field holds every word (any case; 'any' looks at title,\n"
     "artist, album, genre and file name). --add appends them to the queue instead.\n"
     "Exit status 1 when nothing matches.",
     CmdSearch},
    {"ls", "[PATH] [--add]", "browse the media library by folder",
     "Lists the folders and songs in PATH (relative to the library's top folder, or absolute).\n"
     "--add appends every song below PATH to the queue, in path order.",
     CmdLs},
    {"playlists", "", "the saved playlists",
     "Lists the library's saved playlists and the M3U files in the playlist folder\n"
     "(audio_playlist_dir in /etc/tarninfo.conf, else 'playlists' in the library's top folder).",
     CmdPlaylists},
    {"load", "NAME", "append a saved playlist to the queue",
     "Appends the songs of the playlist NAME (its title or file name) to the queue.", CmdLoad},
    {"save", "NAME", "save the queue as playlist NAME",
     "Writes the queue as NAME.m3u into the playlist folder (see playlists). An existing\n"
     "playlist is not replaced.",
     CmdSave},
    {"slot", "save N | load N | list", "custom slots 1 to 9",
     "  slot save N   store the current source (a saved playlist or a radio station) in slot N\n"
     "  slot load N   play the source stored in slot N\n"
     "  slot list     what each slot holds",
     CmdSlot},
    {"source", "random|radio|ipod|playlist|next|prev | custom N", "replace the queue with a whole source",
     "Replaces the queue with a random selection of 100 songs, the radio stations, the iPod\n"
     "track list, the first saved playlist, the next or previous playlist, or custom slot N\n"
     "(as slot load N), and plays it. Playback returns to the local output.",
     CmdSource},
    {"servers", "", "media servers found on the network", "Lists the media servers found so far.", CmdServers},
    {"renderers", "", "renderers found on the network", "Lists the renderers found so far (numbered from 1).",
     CmdRenderers},
    {"discover", "servers|renderers", "search the network again", "Sends a new search for servers or renderers.",
     CmdDiscover},
    {"select", "local|N|NAME", "play on the local output or on renderer N / NAME",
     "local plays through the appliance's own output; N is a number from 'tarnctl renderers';\n"
     "NAME is (part of) a renderer's name.",
     CmdSelect},
    {"wait", "[--timeout SECONDS]", "return when the published status changes",
     "Waits until the player state, the song, the volume, repeat/shuffle or the changed flag\n"
     "change, and prints what changed (player, volume, options, changed). Exit status 1 when\n"
     "the daemon stops or nothing changed within --timeout.",
     CmdWait},
    {"watch", "[--count N] [--interval MS]", "a live status line",
     "Redraws one status line in place, fitted to the terminal's width, until Ctrl-C, N lines,\n"
     "or the daemon stops (then it says so and exits with status 1).",
     CmdWatch},
    {"changed", "[set|clear]", "show, set or clear the changed flag", "The flag clients use to notice changes.",
     CmdChanged},
    {"help", "[COMMAND]", "this list, or the help of one command", "", CmdHelp},
};

const Command *Find(const std::string &name)
{
    static const std::map<std::string, std::string> kAliases = {
        {"previous", "prev"}, {"rm", "del"}, {"remove", "del"}, {"vol", "volume"}, {"random", "shuffle"},
    };
    auto al = kAliases.find(name);
    const std::string &n = al == kAliases.end() ? name : al->second;
    for (const Command &c : kCommands) {
        if (n == c.name)
            return &c;
    }
    return nullptr;
}

void PrintList(FILE *out)
{
    fprintf(out, "usage: tarnctl [--json] [--timeout MS] COMMAND [ARGS]\n\n");
    for (const Command &c : kCommands) {
        std::string head = std::string(c.name) + (*c.args ? " " : "") + c.args;
        if (TextWidth(head) > 30)
            fprintf(out, "  %s\n  %30s  %s\n", head.c_str(), "", c.summary);
        else
            fprintf(out, "  %s  %s\n", TextFit(head, 30).c_str(), c.summary);
    }
    fprintf(out,
            "\nQueue positions count from 1. tarnctl help COMMAND tells more.\n"
            "Options:\n"
            "  --json         print the daemon's replies as sent (its own 0-based numbers)\n"
            "  --timeout MS   how long to wait for an answer (default 3000)\n"
            "  --help, --version\n"
            "Exit status: 0 done; 1 refused or failed (the reason is on stderr);\n"
            "2 usage mistake (the command's usage line is on stderr).\n"
            "The daemon is reached through TARN_ROOT/tmp/tarnaudiod.sock (TARN_ROOT unset: /tmp).\n");
}

int CmdHelp(const Command &c, Args &a)
{
    if (a.empty()) {
        PrintList(stdout);
        return 0;
    }
    if (a.size() > 1)
        return UsageError(c);
    const Command *h = Find(a[0]);
    if (!h)
        return UsageError(c, "no command '%s'", a[0].c_str());
    printf("usage: tarnctl %s%s%s\n\n%s\n", h->name, *h->args ? " " : "", h->args, *h->details ? h->details : h->summary);
    return 0;
}

}  // namespace

int main(int argc, char **argv)
{
    TextInit();
    signal(SIGPIPE, SIG_IGN);
    int i = 1;
    for (; i < argc && argv[i][0] == '-'; ++i) {
        std::string opt = argv[i];
        if (opt == "--json") {
            g_json = true;
        } else if (opt == "--timeout") {
            long ms = 0;
            if (i + 1 >= argc || !ParseInt(argv[i + 1], &ms) || ms < 1) {
                fprintf(stderr, "tarnctl: --timeout takes milliseconds\n");
                fprintf(stderr, "usage: tarnctl [--json] [--timeout MS] COMMAND [ARGS]\n");
                return kExitUsage;
            }
            g_timeoutMs = static_cast<int>(ms);
            ++i;
        } else if (opt == "--help" || opt == "-h") {
            PrintList(stdout);
            return 0;
        } else if (opt == "--version" || opt == "-V") {
            printf("tarnctl %s\n", TARN_VERSION);
            return 0;
        } else {
            fprintf(stderr, "tarnctl: unknown option '%s'\n", argv[i]);
            fprintf(stderr, "usage: tarnctl [--json] [--timeout MS] COMMAND [ARGS]\n");
            return kExitUsage;
        }
    }
    if (i >= argc) {
        PrintList(stderr);
        return kExitUsage;
    }
    const Command *cmd = Find(argv[i]);
    if (!cmd) {
        fprintf(stderr, "tarnctl: unknown command '%s' (tarnctl --help lists them)\n", argv[i]);
        return kExitUsage;
    }
    Args args(argv + i + 1, argv + argc);
    bool json = false, help = false;
    TakeOption(args, "--json", nullptr, &json);
    TakeOption(args, "--help", nullptr, &help);
    if (json)
        g_json = true;
    if (help) {
        Args name = {cmd->name};
        return CmdHelp(*cmd, name);
    }
    std::string stray;
    std::string name = cmd->name;
    bool ownOptions = name == "status" || name == "current" || name == "search" || name == "ls" ||
                      name == "wait" || name == "watch" || name == "queue";
    if (!ownOptions && HasOptionLeft(args, &stray))
        return UsageError(*cmd, "unknown option '%s'", stray.c_str());
    return cmd->run(*cmd, args);
}

