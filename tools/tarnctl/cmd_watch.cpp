// tarnctl: waiting for and watching the published status.
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
                        (p.repeatMode == REPEAT_MODE_ONE   ? " repeat-one"
                         : p.repeatMode == REPEAT_MODE_ALL ? " repeat-all"
                                                           : "") +
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

}  // namespace tarnctl
