// Source change: replaces the local queue with a whole source (a random
// selection, the radio list, the iPod list, a saved or smart playlist, a
// custom slot) by driving the LocalPlayer through its action entry, the
// same way a client would.
#include "source/changesrc.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <list>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <vector>

#include <json/json.h>

#include "platform/tarn_media_info.h"
#include "wire/tarn_wire.h"
#include "platform/media_playlists.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "player/localplayer.h"
#include "source/radiolist.h"

static const char kLogUnit[] = "changesrc";

// The source the local queue was last filled from (SOURCE_TYPE_*), and the
// saved playlist of SOURCE_TYPE_PLAYLIST: the source change's own state.
static int g_sourceType = SOURCE_TYPE_NONE;
static char g_currentPlaylistPath[4096] = "";

#define RANDOM_PLAYLIST_FORMAT "/tmp/==DynaRandom100==.%s"
#define RANDOM_PLAYLIST_OWNER "@remote_control"
#define RANDOM_PLAYLIST_SIZE 100
#define IPOD_TRACK_LIST "/usr/tarn/etc/audio/ipod/tracks.m3u"
#define COVER_URL_FORMAT "modules/Aurelon/webUI/getcover.cgi/ebdart/%lu.jpg"
#define TTY_SIGNAL_DEVICE "/dev/ttyS1"

namespace {

// One step sent to the player; the reply is discarded.
int SendAction(LocalPlayer *player, int action, const void *param, size_t size)
{
    // Heap: a request is 8 KiB and a source change sends hundreds of them.
    std::unique_ptr<ControlRequest> request(new ControlRequest());
    memset(request.get(), 0, sizeof(*request));
    request->action = action;
    if (param && size)
        memcpy(request->parameter, param, size < CTRL_PARAM_SIZE ? size : CTRL_PARAM_SIZE);
    Json::Value reply;
    return player->HandleAction(request.get(), reply);
}

int QueueClear(LocalPlayer *player)
{
    return SendAction(player, ACT_QUEUE_CLEAR, nullptr, 0);
}

int QueueAdd(LocalPlayer *player, const TARN_MEDIA_INFO *info)
{
    return SendAction(player, ACT_QUEUE_ADD, info, sizeof(*info));
}

int SetCoverArtUrl(TARN_MEDIA_INFO *info)
{
    if (!info) {
        TLOG("Bad parameter");
        return -1;
    }
    if (info->id != 0)
        snprintf(info->albumArtUrl, 255, COVER_URL_FORMAT, static_cast<unsigned long>(info->id));
    else
        memset(info->albumArtUrl, 0, 255);
    return 0;
}

// Stops the decoder process and starts the queue again from its top.
int RestartLocalPlayback(LocalPlayer *player)
{
    player->KillByName();
    return SendAction(player, ACT_PLAY_INDEX, "0", 2);
}

int QueuePlaylistByPath(const char *path, LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    int count = 0;
    std::vector<TARN_MEDIA_INFO> songs;
    if (!path || ParsePlayListByFieldGivenPath(path, &count, 0, 0, "*", 1, songs) != 0) {
        TLOG("Failed to get playlist [%s]", path ? path : "");
        return -1;
    }
    QueueClear(player);
    for (TARN_MEDIA_INFO &song : songs) {
        SetCoverArtUrl(&song);
        QueueAdd(player, &song);
    }
    RestartLocalPlayback(player);
    return 0;
}

int QueueSmartPlaylist(const char *name, LocalPlayer *player)
{
    if (!player || !name) {
        TLOG("Bad parameter.");
        return -1;
    }
    int total = 0;
    std::vector<std::string> names = MediaServer::SmartPLSEnum(0, 0, total, nullptr);
    size_t length = strlen(name);
    int index = -1;
    for (size_t i = 0; i < names.size(); i++) {
        if (names[i].size() == length && memcmp(names[i].data(), name, length) == 0) {
            index = static_cast<int>(i);
            break;
        }
    }
    if (index < 0) {
        TLOG("Failed to find Smart Playlist [%s]", name);
        return -1;
    }
    QueueClear(player);
    std::list<TARN_MEDIA_INFO> songs;
    MediaServer::SmartPLSListSongs(index, 0, 0, total, songs);
    for (TARN_MEDIA_INFO &song : songs) {
        SetCoverArtUrl(&song);
        QueueAdd(player, &song);
    }
    RestartLocalPlayback(player);
    return 0;
}

int QueueRadioStation(const char *title, const char *url, LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    QueueClear(player);
    std::unique_ptr<TARN_MEDIA_INFO> info(new TARN_MEDIA_INFO());
    memset(info.get(), 0, sizeof(*info));
    snprintf(info->title, 255, "%s", title ? title : "");
    snprintf(info->path, 4096, "%s", url ? url : "");
    QueueAdd(player, info.get());
    RestartLocalPlayback(player);
    return 0;
}

// 1 when the list's "total" is a non-zero number.
int TotalOf(const Json::Value &list)
{
    if (!list.isObject())
        return 0;
    const Json::Value &total = list["total"];
    return total.isNumeric() && total.asDouble() != 0 ? 1 : 0;
}

// Favourite list, else user-defined list, else the RadioIO list: the first
// whose "total" is non-zero.
int GetRadioListForSource(Json::Value &list)
{
    list = Json::Value();
    if (RadioListGet(RADIO_LIST_FAVORITE, list) != 0) {
        TLOG("Failed to get favorite radio list.");
        return -1;
    }
    if (TotalOf(list) != 0)
        return 0;

    list = Json::Value();
    if (RadioListGet(RADIO_LIST_USERDEF, list) != 0) {
        TLOG("Failed to get user-defined radio list.");
        return -1;
    }
    if (TotalOf(list) != 0)
        return 0;

    list = Json::Value();
    if (RadioioListGet(list, false) != 0) {
        TLOG("Failed to get RadioIO radio list.");
        return -1;
    }
    return TotalOf(list) != 0 ? 0 : -1;
}

std::string TextOf(const Json::Value &station, const char *key)
{
    if (!station.isObject())
        return std::string();
    const Json::Value &v = station[key];
    return v.isString() ? v.asString() : std::string();
}

// Tells the front panel controller over the serial line that a preset was
// stored (2) or not (3).
void SignalTtyS1(bool ok)
{
    std::string device = TarnPath(TTY_SIGNAL_DEVICE);
    char command[64 + 4096];
    if (TarnRoot().empty()) {
        snprintf(command, 64, "/bin/echo %d > %s", ok ? 2 : 3, device.c_str());
    } else {
        // Under a relocated root the device is a plain file there; quote the
        // root, which may hold any character.
        std::string quoted = "'";
        for (char c : device) {
            if (c == '\'')
                quoted += "'\\''";
            else
                quoted += c;
        }
        quoted += "'";
        snprintf(command, sizeof(command), "/bin/echo %d > %s", ok ? 2 : 3, quoted.c_str());
    }
    int rc = system(command);
    (void)rc;
}

// Next (step 1) or previous (step -1) source: a new random selection, or the
// saved playlist after / before the current one, wrapping at both ends.
int ChangeSourceStep(LocalPlayer *player, int step)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    if (g_sourceType == SOURCE_TYPE_RANDOM)
        return ChangeSourceRandom100(player, true);
    if (g_sourceType != SOURCE_TYPE_PLAYLIST)
        return -1;
    if (!g_currentPlaylistPath[0]) {
        TLOG("source in playlist, but no path");
        return -1;
    }
    std::vector<TARN_PLAYLIST_INFO> lists;
    if (TARNPlaylistListAll(lists, 0, 0, 0) != 0) {
        TLOG("Failed to get playlist from db.");
        return -1;
    }
    if (lists.empty())
        return -1;
    size_t n = lists.size();
    size_t found = n;
    for (size_t i = 0; i < n; i++) {
        if (strcmp(lists[i].path.c_str(), g_currentPlaylistPath) == 0) {
            found = i;
            break;
        }
    }
    if (found == n)
        return -1;
    size_t chosen = step > 0 ? (found + 1) % n : (found + n - 1) % n;
    std::string path = lists[chosen].path;
    QueuePlaylistByPath(path.c_str(), player);
    g_sourceType = SOURCE_TYPE_PLAYLIST;
    snprintf(g_currentPlaylistPath, sizeof(g_currentPlaylistPath), "%s", path.c_str());
    return 0;
}

}  // namespace

int ChangeSourceRandom100(LocalPlayer *player, bool regenerate)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    char name[4096];
    memset(name, 0, sizeof(name));
    snprintf(name, sizeof(name), RANDOM_PLAYLIST_FORMAT, RANDOM_PLAYLIST_OWNER);
    std::string path = TarnPath(name);

    struct stat st;
    bool keep = !regenerate && stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
    if (!keep && AudioFile::PlaylistRandomCreate(path.c_str(), RANDOM_PLAYLIST_SIZE) == 0) {
        TLOG("Failed to create random100 playlist");
        return -1;
    }
    std::unique_ptr<AudioFile::PlaylistFile> loaded(AudioFile::PlaylistFileLoad(path.c_str(), 0, 0));
    if (!loaded) {
        TLOG("Cannot load the playlist from %s", path.c_str());
        return -1;
    }
    QueueClear(player);
    for (TARN_MEDIA_INFO &song : loaded->songs) {
        SetCoverArtUrl(&song);
        QueueAdd(player, &song);
    }
    RestartLocalPlayback(player);
    g_sourceType = SOURCE_TYPE_RANDOM;
    return 0;
}

int ChangeSourceRadio(LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    Json::Value list;
    if (GetRadioListForSource(list) != 0) {
        TLOG("Failed to get radio list for changing source.");
        return -1;
    }
    const Json::Value &stations = list["stations"];
    if (!stations.isArray() || stations.empty())
        return -1;

    QueueClear(player);
    std::unique_ptr<TARN_MEDIA_INFO> info(new TARN_MEDIA_INFO());
    for (Json::ArrayIndex i = 0; i < stations.size(); i++) {
        memset(info.get(), 0, sizeof(*info));
        snprintf(info->title, 255, "%s", TextOf(stations[i], "name").c_str());
        snprintf(info->path, 4096, "%s", TextOf(stations[i], "url").c_str());
        QueueAdd(player, info.get());
    }
    RestartLocalPlayback(player);
    g_sourceType = SOURCE_TYPE_RADIO;
    return 0;
}

int ChangeSourceIPod(LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    std::vector<TARN_MEDIA_INFO> tracks;
    std::string path = TarnPath(IPOD_TRACK_LIST);
    int count = TARNIPodListSongsAll(path.c_str(), tracks, 0, 100);
    if (count == -1 || count == 0)
        return -1;
    QueueClear(player);
    for (const TARN_MEDIA_INFO &track : tracks)
        QueueAdd(player, &track);
    RestartLocalPlayback(player);
    g_sourceType = SOURCE_TYPE_IPOD;
    return 0;
}

int ChangeSourceFirstPlaylist(LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    std::vector<TARN_PLAYLIST_INFO> lists;
    if (TARNPlaylistListAll(lists, 0, 1, 0) != 0) {
        TLOG("Failed to get playlist from db.");
        return -1;
    }
    if (lists.empty())
        return -1;
    std::string path = lists.front().path;
    if (QueuePlaylistByPath(path.c_str(), player) != 0) {
        // Names the playlist that was playing before, as it always has.
        TLOG("Failed to change source to playlist [%s]", g_currentPlaylistPath);
        return -1;
    }
    g_sourceType = SOURCE_TYPE_PLAYLIST;
    snprintf(g_currentPlaylistPath, sizeof(g_currentPlaylistPath), "%s", path.c_str());
    return 0;
}

int ChangeSourceCustom(int slot, LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    std::string type, second, third;
    if (TARNAudioCustomGet(slot, type, second, third) != 0)
        return -1;
    // The load's own result does not count: a known slot type always
    // switches the source to the slot.
    if (type == "smart") {
        QueueSmartPlaylist(second.c_str(), player);
    } else if (type == "playlist") {
        QueuePlaylistByPath(second.c_str(), player);
    } else if (type == "radio") {
        QueueRadioStation(third.c_str(), second.c_str(), player);
    } else {
        TLOG("invalid custom type [%s]", type.c_str());
        return -1;
    }
    g_sourceType = SOURCE_TYPE_CUSTOM;
    return 0;
}

int ChangeSourceNext(LocalPlayer *player)
{
    return ChangeSourceStep(player, 1);
}

int ChangeSourcePrevious(LocalPlayer *player)
{
    return ChangeSourceStep(player, -1);
}

int SaveCustomSource(int slot, LocalPlayer *player)
{
    if (!player) {
        TLOG("Bad parameter.");
        return -1;
    }
    int rc;
    if (g_sourceType == SOURCE_TYPE_PLAYLIST) {
        char title[255];
        memset(title, 0, sizeof(title));
        if (TARNPlaylistTitleGetByPath(g_currentPlaylistPath, title, 255) != 0)
            return -1;
        rc = TARNAudioCustomSet(slot, "playlist", g_currentPlaylistPath, title);
    } else if (g_sourceType == SOURCE_TYPE_RADIO) {
        std::string path, title;
        if (player->GetCurrentSong(path, title) != 0)
            return -1;
        rc = TARNAudioCustomSet(slot, "radio", path, title);
    } else {
        // Random selections, iPod lists and slots themselves are not stored.
        return 0;
    }
    if (rc != 0)
        return -1;
    SignalTtyS1(true);
    return 0;
}
