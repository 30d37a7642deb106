// tarnctl: the queue commands.
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

}  // namespace tarnctl
