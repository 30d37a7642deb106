// tarnctl: the media library commands (search, ls, playlists, load, save).
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

}  // namespace tarnctl
