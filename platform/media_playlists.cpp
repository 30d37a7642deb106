// Playlist functions of the media library used by the daemon.
#include "platform/media_playlists.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <json/json.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/json_read.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"

namespace fs = std::filesystem;

static const char kLogUnit[] = "medialib";

// Opens the default library for one call; an open failure is logged.
static bool OpenLibrary(MediaLib &lib)
{
    return lib.Open(MediaLibDefaultPath(), false) == 0;
}

// Writes text to path whole or not at all: a temporary file beside it,
// flushed to disk, renamed over it.
static int WriteFileAtomic(const std::string &path, const std::string &text)
{
    std::error_code ec;
    fs::path parent = fs::path(path).parent_path();
    if (!parent.empty())
        fs::create_directories(parent, ec);
    std::string tmp = path + ".tmp." + std::to_string(getpid());
    int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) {
        TLOG("Cannot create %s: %m", tmp.c_str());
        return -1;
    }
    size_t off = 0;
    while (off < text.size()) {
        ssize_t n = write(fd, text.data() + off, text.size() - off);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            TLOG("Cannot write %s: %m", tmp.c_str());
            close(fd);
            unlink(tmp.c_str());
            return -1;
        }
        off += (size_t)n;
    }
    if (fsync(fd) != 0 || close(fd) != 0) {
        TLOG("Cannot write %s: %m", tmp.c_str());
        unlink(tmp.c_str());
        return -1;
    }
    if (rename(tmp.c_str(), path.c_str()) != 0) {
        TLOG("Cannot replace %s: %m", path.c_str());
        unlink(tmp.c_str());
        return -1;
    }
    int dfd = open(parent.empty() ? "." : parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dfd >= 0) {
        fsync(dfd);
        close(dfd);
    }
    return 0;
}

// The song for one playlist entry: from the library when it knows the path,
// else from the file's own tags. False when the file is missing or unplayable.
static bool ResolveEntry(MediaLib *lib, const M3uEntry &entry, TARN_MEDIA_INFO *info)
{
    MediaSong song;
    if (lib && lib->FindByPath(entry.path, &song) == 1) {
        struct stat st;
        if (stat(entry.path.c_str(), &st) != 0)
            return false;  // deleted since the last scan
        MediaSongToInfo(song, info);
        return true;
    }
    std::string why, warning;
    if (!MediaLibIsAudioFile(entry.path) || MediaReadTags(entry.path, &song, &why, &warning) != 0)
        return false;
    if (!entry.title.empty() && song.title == fs::path(entry.path).stem().string())
        song.title = entry.title;  // the file had no title tag
    MediaSongToInfo(song, info);
    return true;
}

// Resolves the entries of an M3U file, paging the playable ones.
static void ResolveEntries(MediaLib *lib, const std::vector<M3uEntry> &entries, int start, int limit,
                           std::vector<TARN_MEDIA_INFO> *songs)
{
    int playable = 0;
    TARN_MEDIA_INFO info;
    for (const M3uEntry &e : entries) {
        if (limit > 0 && (int)songs->size() >= limit)
            break;
        if (!ResolveEntry(lib, e, &info))
            continue;
        if (playable++ < start)
            continue;
        songs->push_back(info);
    }
}

// ---------------------------------------------------------------------------

int AudioFile::PlaylistRandomCreate(const char *path, int count)
{
    if (!path || !*path || count < 1) {
        TLOG("Bad parameter");
        return 0;
    }
    MediaLib lib;
    if (!OpenLibrary(lib))
        return 0;
    std::vector<MediaSong> songs;
    if (lib.RandomSongs(count, &songs) != 0)
        return 0;
    if (songs.empty()) {
        TLOG("The media library has no songs; run \"tarnlib scan DIR\" first");
        return 0;
    }
    std::string text = "#EXTM3U\n#PLAYLIST:Random " + std::to_string(count) + "\n";
    for (const MediaSong &s : songs) {
        text += "#EXTINF:" + std::to_string((int)s.duration) + "," +
                (s.artist.empty() ? s.title : s.artist + " - " + s.title) + "\n";
        text += s.path + "\n";
    }
    return WriteFileAtomic(path, text) == 0 ? 1 : 0;
}

AudioFile::PlaylistFile *AudioFile::PlaylistFileLoad(const char *path, int start, int limit)
{
    if (!path || !*path)
        return nullptr;
    std::string title;
    std::vector<M3uEntry> entries;
    if (M3uRead(path, &title, &entries) != 0) {
        TLOG("Cannot read playlist %s: %m", path);
        return nullptr;
    }
    MediaLib lib;
    bool haveLib = lib.Open(MediaLibDefaultPath(), false) == 0;
    PlaylistFile *file = new PlaylistFile;
    file->title = title;
    ResolveEntries(haveLib ? &lib : nullptr, entries, start, limit, &file->songs);
    return file;
}

int TARNPlaylistListAll(std::vector<TARN_PLAYLIST_INFO> &list, int start, int limit, int flags)
{
    list.clear();
    MediaLib lib;
    if (!OpenLibrary(lib))
        return -1;
    std::vector<MediaPlaylist> all;
    if (lib.ListPlaylists(&all) != 0)
        return -1;
    for (size_t i = start > 0 ? (size_t)start : 0; i < all.size(); i++) {
        if (limit > 0 && (int)list.size() >= limit)
            break;
        list.push_back(TARN_PLAYLIST_INFO{all[i].path, all[i].title});
    }
    return 0;
}

int ParsePlayListByFieldGivenPath(const char *path, int *count, int start, int limit, const char *field,
                                  int resolve, std::vector<TARN_MEDIA_INFO> &songs)
{
    songs.clear();
    if (count)
        *count = 0;
    if (!path || !*path)
        return -1;
    std::string title;
    std::vector<M3uEntry> entries;
    if (M3uRead(path, &title, &entries) != 0) {
        TLOG("Cannot read playlist %s: %m", path);
        return -1;
    }
    MediaLib lib;
    bool haveLib = lib.Open(MediaLibDefaultPath(), false) == 0;
    ResolveEntries(haveLib ? &lib : nullptr, entries, start, limit, &songs);
    if (count)
        *count = (int)songs.size();
    return songs.empty() ? -1 : 0;
}

int TARNPlaylistTitleGetByPath(const char *path, char *title, int size)
{
    if (!path || !title || size < 1)
        return -1;
    MediaLib lib;
    if (lib.Open(MediaLibDefaultPath(), false) == 0) {
        MediaPlaylist p;
        if (lib.FindPlaylist(path, &p) == 1) {
            snprintf(title, size, "%s", p.title.c_str());
            return 0;
        }
    }
    std::string t;
    std::vector<M3uEntry> entries;
    if (M3uRead(path, &t, &entries) != 0)
        return -1;
    snprintf(title, size, "%s", t.c_str());
    return 0;
}

std::vector<std::string> MediaServer::SmartPLSEnum(int start, int limit, int &total, const char *filter)
{
    std::vector<std::string> names;
    total = 0;
    MediaLib lib;
    std::vector<SmartPlaylist> all;
    if (!OpenLibrary(lib) || lib.ListSmart(&all) != 0)
        return names;
    total = (int)all.size();
    for (size_t i = start > 0 ? (size_t)start : 0; i < all.size(); i++) {
        if (limit > 0 && (int)names.size() >= limit)
            break;
        names.push_back(all[i].name);
    }
    return names;
}

int MediaServer::SmartPLSListSongs(int index, int start, int limit, int &total,
                                   std::list<TARN_MEDIA_INFO> &songs)
{
    total = 0;
    MediaLib lib;
    std::vector<SmartPlaylist> all;
    if (!OpenLibrary(lib) || lib.ListSmart(&all) != 0)
        return -1;
    if (index < 0 || index >= (int)all.size()) {
        TLOG("No smart playlist at index %d (%d in the library)", index, (int)all.size());
        return -1;
    }
    std::vector<MediaSong> found;
    if (lib.SmartSongs(all[index], &found, start, limit, &total) != 0)
        return -1;
    TARN_MEDIA_INFO info;
    for (const MediaSong &s : found) {
        MediaSongToInfo(s, &info);
        songs.push_back(info);
    }
    return 0;
}

int TARNIPodListSongsAll(const char *path, std::vector<TARN_MEDIA_INFO> &songs, int start, int limit)
{
    songs.clear();
    if (!path)
        return -1;
    std::string title;
    std::vector<M3uEntry> entries;
    if (M3uRead(path, &title, &entries) != 0)
        return -1;  // no portable player connected
    MediaLib lib;
    bool haveLib = lib.Open(MediaLibDefaultPath(), false) == 0;
    ResolveEntries(haveLib ? &lib : nullptr, entries, start, limit, &songs);
    return (int)songs.size();
}

// ---------------------------------------------------------------------------
// Custom slots: {"slots": {"<n>": {"type": ..., "second": ..., "third": ...}}}

// Far more than the slots ever need.
static const size_t kCustomSlotsMaxBytes = 1024 * 1024;

static std::string CustomSlotsPath()
{
    return TarnPath("/usr/tarn/etc/audio/custom_slots.json");
}

static int ReadSlots(Json::Value *root)
{
    std::string path = CustomSlotsPath();
    if (access(path.c_str(), F_OK) != 0)
        return -1;
    std::string errs;
    if (JsonReadFileBounded(path, kCustomSlotsMaxBytes, JSON_READ_MAX_DEPTH, root, &errs) != 0 ||
        !root->isObject()) {
        TLOG("Custom slot file %s is damaged: %s", CustomSlotsPath().c_str(), errs.c_str());
        return -1;
    }
    return 0;
}

int TARNAudioCustomGet(int slot, std::string &type, std::string &second, std::string &third)
{
    Json::Value root;
    if (ReadSlots(&root) != 0)
        return -1;
    const Json::Value &slots = root["slots"];
    std::string key = std::to_string(slot);
    if (!slots.isObject() || !slots.isMember(key) || !slots[key].isObject())
        return -1;
    const Json::Value &s = slots[key];
    if (!s["type"].isString())
        return -1;
    type = s["type"].asString();
    second = s["second"].isString() ? s["second"].asString() : std::string();
    third = s["third"].isString() ? s["third"].asString() : std::string();
    return 0;
}

int TARNAudioCustomSet(int slot, const std::string &type, const std::string &second, const std::string &third)
{
    Json::Value root;
    if (ReadSlots(&root) != 0) {
        // A missing or damaged file starts again empty; a damaged file is kept
        // beside the new one for inspection.
        std::string path = CustomSlotsPath();
        if (access(path.c_str(), F_OK) == 0)
            rename(path.c_str(), (path + ".damaged").c_str());
        root = Json::Value(Json::objectValue);
    }
    if (!root["slots"].isObject())
        root["slots"] = Json::Value(Json::objectValue);
    Json::Value s(Json::objectValue);
    s["type"] = type;
    s["second"] = second;
    s["third"] = third;
    root["slots"][std::to_string(slot)] = s;
    Json::StreamWriterBuilder w;
    w["indentation"] = "  ";
    return WriteFileAtomic(CustomSlotsPath(), Json::writeString(w, root) + "\n");
}

int MediaLibFindById(uint32_t id, TARN_MEDIA_INFO *info)
{
    if (!info)
        return -1;
    MediaLib lib;
    if (!OpenLibrary(lib))
        return -1;
    MediaSong song;
    int rc = lib.FindById(id, &song);
    if (rc == 1)
        MediaSongToInfo(song, info);
    return rc;
}

int MediaLibPathById(uint32_t id, char *path, size_t size)
{
    if (!path || size == 0)
        return -1;
    TARN_MEDIA_INFO info;
    int rc = MediaLibFindById(id, &info);
    if (rc == 1)
        snprintf(path, size, "%s", info.path);
    return rc;
}
