// tarnctl: the playback commands (play, pause, stop, next, seek, volume,
// modes, status, equalizer).
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
    bool wrap = s.repeat == REPEAT_MODE_ALL;
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
    // Positions come in whole seconds; the one from before the seek counts
    // only when it is the target itself (a short seek back must not be
    // taken as done while the old position still shows).
    Snapshot after;
    auto arrived = [&](const Snapshot &x) {
        bool near = x.position >= target - 1 && x.position <= target + 2;
        return near && (x.position != s.position || x.position == target);
    };
    if (!WaitFor(arrived, 2000, &after))
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
        int mode = a[0] == "off"   ? REPEAT_MODE_OFF
                   : a[0] == "one" ? REPEAT_MODE_ONE
                   : a[0] == "all" ? REPEAT_MODE_ALL
                                   : REPEAT_MODE_NONE;
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
            return UsageError(c, "%s", ("unknown field " + bad + " in the format; fields: " + kFormatFields).c_str());
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

}  // namespace tarnctl
