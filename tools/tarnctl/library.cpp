#include "tools/tarnctl/library.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <set>

#include "audio/info.h"
#include "platform/tarn_env.h"
#include "platform/tlibc_conf.h"
#include "tools/tarnctl/text.h"

namespace fs = std::filesystem;

namespace {

std::unique_ptr<MediaLib> g_lib;
std::string g_libError;
bool g_libTried = false;

std::string Absolute(const std::string &path)
{
    char *real = realpath(path.c_str(), nullptr);
    if (real) {
        std::string out = real;
        free(real);
        return out;
    }
    std::error_code ec;
    fs::path abs = fs::absolute(path, ec);
    return ec ? path : abs.lexically_normal().string();
}

bool IsPlayable(const std::string &path)
{
    return MediaLibIsAudioFile(path) && AudioIsSupportedFile(1, path.c_str()) == 1;
}

void UrlRecord(const std::string &url, TARN_MEDIA_INFO *info)
{
    memset(info, 0, sizeof(*info));
    snprintf(info->path, sizeof(info->path), "%s", url.c_str());
}

std::string Lower(std::string s)
{
    for (char &c : s)
        c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
    return s;
}

// Folder entries below dir that are playable songs, in path order.
void SongsBelow(const std::string &dir, std::vector<std::string> *files)
{
    std::error_code ec;
    fs::recursive_directory_iterator it(dir, fs::directory_options::skip_permission_denied, ec), end;
    for (; !ec && it != end; it.increment(ec)) {
        std::error_code ec2;
        if (it->is_regular_file(ec2) && IsPlayable(it->path().string()))
            files->push_back(it->path().string());
    }
    std::sort(files->begin(), files->end());
}

}  // namespace

MediaLib *LibraryOpen(std::string *why)
{
    if (!g_libTried) {
        g_libTried = true;
        std::unique_ptr<MediaLib> lib(new MediaLib());
        if (lib->Open(MediaLibDefaultPath(), false, true) == 0)
            g_lib = std::move(lib);
        else
            g_libError = lib->LastError();
    }
    if (!g_lib && why)
        *why = g_libError;
    return g_lib.get();
}

bool IsUrl(const std::string &text)
{
    size_t p = text.find("://");
    if (p == std::string::npos || p == 0)
        return false;
    for (size_t i = 0; i < p; ++i) {
        if (!isalnum(static_cast<unsigned char>(text[i])) && text[i] != '+' && text[i] != '-' &&
            text[i] != '.')
            return false;
    }
    return Lower(text.substr(0, p)) != "file";
}

int SongForFile(const std::string &pathIn, TARN_MEDIA_INFO *info, std::string *why)
{
    std::string path = Absolute(pathIn);
    struct stat st;
    if (stat(path.c_str(), &st) != 0) {
        *why = strerror(errno);
        return -1;
    }
    if (!S_ISREG(st.st_mode)) {
        *why = "not a file";
        return -1;
    }
    if (access(path.c_str(), R_OK) != 0) {
        *why = strerror(errno);
        return -1;
    }
    if (!IsPlayable(path)) {
        *why = "not a kind of song the player can play";
        return -1;
    }
    MediaSong song;
    MediaLib *lib = LibraryOpen(nullptr);
    if (lib && lib->FindByPath(path, &song) == 1) {
        MediaSongToInfo(song, info);
        return 0;
    }
    song = MediaSong();
    std::string warning;
    if (MediaReadTags(path, &song, why, &warning) != 0)
        return -1;
    song.path = path;
    song.id = 0;
    MediaSongToInfo(song, info);
    return 0;
}

void SongsForArgs(const std::vector<std::string> &args,
                  std::vector<std::unique_ptr<TARN_MEDIA_INFO>> *songs,
                  std::vector<std::string> *problems, std::vector<std::string> *warnings)
{
    auto addFile = [&](const std::string &file, std::string *why) {
        std::unique_ptr<TARN_MEDIA_INFO> info(new TARN_MEDIA_INFO());
        if (SongForFile(file, info.get(), why) != 0)
            return false;
        songs->push_back(std::move(info));
        return true;
    };
    for (const std::string &arg : args) {
        std::string why;
        if (IsUrl(arg)) {
            std::unique_ptr<TARN_MEDIA_INFO> info(new TARN_MEDIA_INFO());
            UrlRecord(arg, info.get());
            songs->push_back(std::move(info));
            continue;
        }
        std::string path = arg;
        if (path.compare(0, 7, "file://") == 0)
            path = path.substr(7);
        struct stat st;
        if (stat(path.c_str(), &st) != 0) {
            problems->push_back(arg + ": " + strerror(errno));
            continue;
        }
        if (S_ISDIR(st.st_mode)) {
            std::vector<std::string> files;
            SongsBelow(path, &files);
            size_t before = songs->size();
            for (const std::string &f : files) {
                if (!addFile(f, &why))
                    warnings->push_back(f + ": " + why + " (skipped)");
            }
            if (songs->size() == before)
                problems->push_back(arg + ": no playable songs in this folder");
            continue;
        }
        if (MediaLibIsPlaylistFile(path)) {
            std::string title;
            std::vector<M3uEntry> entries;
            if (M3uRead(Absolute(path), &title, &entries) != 0) {
                problems->push_back(arg + ": cannot read this playlist");
                continue;
            }
            size_t before = songs->size();
            for (const M3uEntry &e : entries) {
                if (IsUrl(e.path)) {
                    std::unique_ptr<TARN_MEDIA_INFO> info(new TARN_MEDIA_INFO());
                    UrlRecord(e.path, info.get());
                    if (!e.title.empty())
                        snprintf(info->title, sizeof(info->title), "%s", e.title.c_str());
                    songs->push_back(std::move(info));
                } else if (!addFile(e.path, &why)) {
                    warnings->push_back(arg + ": " + e.path + ": " + why + " (skipped)");
                }
            }
            if (songs->size() == before)
                problems->push_back(arg + ": no playable songs in this playlist");
            continue;
        }
        if (!addFile(path, &why))
            problems->push_back(arg + ": " + why);
    }
}

int LibrarySearch(const std::string &field, const std::vector<std::string> &words,
                  std::vector<MediaSong> *songs, std::string *why)
{
    MediaLib *lib = LibraryOpen(why);
    if (!lib)
        return -1;
    std::vector<MediaSong> all;
    if (lib->ListSongs(&all) != 0) {
        *why = lib->LastError();
        return -1;
    }
    std::vector<std::string> folded;
    for (const std::string &w : words)
        folded.push_back(TextFold(w));
    for (MediaSong &s : all) {
        std::string hay;
        if (field == "artist")
            hay = s.artist;
        else if (field == "album")
            hay = s.album;
        else if (field == "title")
            hay = s.title;
        else
            hay = s.title + "\n" + s.artist + "\n" + s.album + "\n" + s.genre + "\n" +
                  fs::path(s.path).filename().string();
        hay = TextFold(hay);
        bool all_found = true;
        for (const std::string &w : folded) {
            if (hay.find(w) == std::string::npos) {
                all_found = false;
                break;
            }
        }
        if (all_found)
            songs->push_back(std::move(s));
    }
    return 0;
}

std::string LibraryRoot(const std::vector<MediaSong> &all)
{
    if (all.empty())
        return std::string();
    std::string lo = all.front().path, hi = lo;
    for (const MediaSong &s : all) {
        lo = std::min(lo, s.path);
        hi = std::max(hi, s.path);
    }
    size_t n = 0;
    while (n < lo.size() && n < hi.size() && lo[n] == hi[n])
        ++n;
    std::string common = lo.substr(0, n);
    size_t slash = common.rfind('/');
    if (slash == std::string::npos)
        return "/";
    return slash == 0 ? "/" : common.substr(0, slash);
}

std::string PlaylistFolder(std::string *why)
{
    char value[4096];
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "audio_playlist_dir", value, sizeof(value), 0) > 0)
        return value;
    MediaLib *lib = LibraryOpen(why);
    if (!lib)
        return std::string();
    std::vector<MediaSong> all;
    if (lib->ListSongs(&all) != 0) {
        *why = lib->LastError();
        return std::string();
    }
    std::string root = LibraryRoot(all);
    if (root.empty()) {
        *why = "the media library holds no songs; set audio_playlist_dir in " + conf;
        return std::string();
    }
    return root == "/" ? "/playlists" : root + "/playlists";
}

std::vector<NamedPlaylist> AllPlaylists(std::string *why)
{
    std::vector<NamedPlaylist> out;
    std::set<std::string> seen;
    MediaLib *lib = LibraryOpen(why);
    if (lib) {
        std::vector<MediaPlaylist> lists;
        if (lib->ListPlaylists(&lists) == 0) {
            for (const MediaPlaylist &p : lists) {
                out.push_back({p.title, p.path});
                seen.insert(p.path);
            }
        }
    }
    std::string ignored;
    std::string folder = PlaylistFolder(&ignored);
    std::vector<NamedPlaylist> extra;
    std::error_code ec;
    if (!folder.empty()) {
        for (fs::directory_iterator it(folder, ec), end; !ec && it != end; it.increment(ec)) {
            std::string p = it->path().string();
            if (!MediaLibIsPlaylistFile(p) || seen.count(Absolute(p)) || seen.count(p))
                continue;
            std::string title;
            std::vector<M3uEntry> entries;
            if (M3uRead(p, &title, &entries) == 0)
                extra.push_back({title, p});
        }
    }
    std::sort(extra.begin(), extra.end(),
              [](const NamedPlaylist &a, const NamedPlaylist &b) { return a.path < b.path; });
    out.insert(out.end(), extra.begin(), extra.end());
    return out;
}
