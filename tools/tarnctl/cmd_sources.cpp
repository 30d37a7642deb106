// tarnctl: source changes, custom slots, players and the network.
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

}  // namespace tarnctl
