// tarnlib: builds and inspects the appliance's media library.
//
//   tarnlib [--db FILE] scan [DIR...]     (no DIR: the folders of music_dir)
//   tarnlib [--db FILE] songs
//   tarnlib [--db FILE] playlists
//   tarnlib [--db FILE] playlist show PATH
//   tarnlib [--db FILE] smart list | show NAME | create NAME [--any] RULE... | delete NAME
//   tarnlib custom show N | set N TYPE TEXT TEXT
//
// The library file is TARN_ROOT/usr/tarn/var/medialib.db unless --db names
// another one.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "platform/tarn_version.h"
#include "platform/tlibc_conf.h"

static void Usage(FILE *out = stderr)
{
    fprintf(out,
            "usage: tarnlib [--db FILE] COMMAND\n"
            "  scan [DIR...]                  add, update and remove the songs and playlists of each\n"
            "                                 DIR (default: the music_dir folders of tarninfo.conf)\n"
            "  songs                          list the songs of the library\n"
            "  playlists                      list the saved playlists\n"
            "  playlist show PATH             list the songs of a saved playlist\n"
            "  smart list                     list the smart playlists and their rules\n"
            "  smart show NAME                list the songs of a smart playlist\n"
            "  smart create NAME [--any] RULE...\n"
            "                                 create or replace a smart playlist; a RULE is one\n"
            "                                 argument: \"genre is Jazz\", \"year from 1990 to 1999\",\n"
            "                                 \"artist contains Miles\", \"title starts with A\",\n"
            "                                 \"genre is not Pop\", \"duration above 300\"\n"
            "                                 (--any: a song matching any rule is taken)\n"
            "  smart delete NAME              delete a smart playlist\n"
            "  custom show N                  show custom slot N\n"
            "  custom set N TYPE TEXT TEXT    store a custom slot (TYPE playlist, smart or radio)\n");
}

static int OpenLib(MediaLib &lib, bool create)
{
    if (lib.Open(MediaLibDefaultPath(), create) != 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return -1;
    }
    return 0;
}

static void PrintSong(const MediaSong &s)
{
    int secs = (int)s.duration;
    printf("%u\t%s\t%s\t%s\t%s\t%d\t%d\t%d:%02d\t%s\n", s.id, s.artist.c_str(), s.album.c_str(),
           s.title.c_str(), s.genre.c_str(), s.year, s.track, secs / 60, secs % 60, s.path.c_str());
}

static void PrintInfo(const TARN_MEDIA_INFO &s)
{
    int secs = (int)s.duration;
    printf("%u\t%s\t%s\t%s\t%s\t%d\t%d\t%d:%02d\t%s\n", s.id, s.artist, s.album, s.title, s.genre, s.year,
           s.track, secs / 60, secs % 60, s.path);
}

static int CmdScan(const char *dir)
{
    struct stat st;
    if (stat(dir, &st) != 0 || !S_ISDIR(st.st_mode)) {
        fprintf(stderr, "tarnlib: cannot scan %s: not a readable folder\n", dir);
        return 1;
    }
    MediaLib lib;
    if (OpenLib(lib, true) != 0)
        return 1;
    bool tty = isatty(STDERR_FILENO);
    auto started = std::chrono::steady_clock::now();
    int lastPct = -1;
    auto progress = [&](int done, int total) {
        if (!tty || total == 0)
            return;
        int pct = (int)(100LL * done / total);
        if (pct == lastPct && done != total)
            return;
        lastPct = pct;
        const int width = 40;
        int fill = width * done / total;
        fprintf(stderr, "\r[%.*s%*s] %3d%% %d/%d files", fill, "########################################",
                width - fill, "", pct, done, total);
        if (done == total)
            fputc('\n', stderr);
        fflush(stderr);
    };
    ScanReport r;
    if (lib.Scan(dir, &r, progress) != 0) {
        fprintf(stderr, "tarnlib: scan failed: %s\n", lib.LastError().c_str());
        return 1;
    }
    double secs = std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count();
    printf("Scanned %s in %.1f s: %d audio files, %d added, %d updated, %d unchanged, %d removed, %d failed;"
           " %d saved playlists; %d songs in the library\n",
           dir, secs, r.seen, r.added, r.updated, r.unchanged, r.removed, r.failed, r.playlists, lib.SongCount());
    for (const std::string &f : r.failures)
        printf("failed: %s\n", f.c_str());
    for (const std::string &w : r.warnings)
        printf("warning: %s\n", w.c_str());
    return 0;
}

// The folders of "music_dir" in the configuration, separated by ':'.
static std::vector<std::string> MusicDirs()
{
    std::vector<std::string> dirs;
    char value[4096] = "";
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "music_dir", value, sizeof(value), 0) <= 0)
        return dirs;
    std::string all(value);
    size_t start = 0;
    while (start <= all.size()) {
        size_t end = all.find(':', start);
        if (end == std::string::npos)
            end = all.size();
        std::string dir = all.substr(start, end - start);
        while (!dir.empty() && (dir.back() == ' ' || dir.back() == '\t'))
            dir.pop_back();
        size_t lead = dir.find_first_not_of(" \t");
        if (lead != std::string::npos && !dir.empty())
            dirs.push_back(dir.substr(lead));
        start = end + 1;
    }
    return dirs;
}

// Scans each folder given, or those of music_dir; 1 when any failed.
static int CmdScanAll(int argc, char **argv)
{
    std::vector<std::string> dirs(argv, argv + argc);
    if (dirs.empty()) {
        dirs = MusicDirs();
        if (dirs.empty()) {
            fprintf(stderr, "tarnlib: no music folder: give one (tarnlib scan DIR) or set music_dir in %s\n",
                    TarnPath(TARN_INFO_CONF).c_str());
            return 2;
        }
    }
    int rc = 0;
    for (const std::string &dir : dirs) {
        if (CmdScan(dir.c_str()) != 0)
            rc = 1;
    }
    return rc;
}

static int CmdSongs()
{
    MediaLib lib;
    if (OpenLib(lib, false) != 0)
        return 1;
    std::vector<MediaSong> songs;
    if (lib.ListSongs(&songs) != 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return 1;
    }
    for (const MediaSong &s : songs)
        PrintSong(s);
    return 0;
}

static int CmdPlaylists()
{
    MediaLib lib;
    if (OpenLib(lib, false) != 0)
        return 1;
    std::vector<MediaPlaylist> lists;
    if (lib.ListPlaylists(&lists) != 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return 1;
    }
    for (const MediaPlaylist &p : lists)
        printf("%s\t%s\n", p.title.c_str(), p.path.c_str());
    return 0;
}

static int CmdPlaylistShow(const char *path)
{
    AudioFile::PlaylistFile *file = AudioFile::PlaylistFileLoad(path, 0, 0);
    if (!file) {
        fprintf(stderr, "tarnlib: cannot read playlist %s: %s\n", path, strerror(errno));
        return 1;
    }
    printf("# %s: %zu playable songs\n", file->title.c_str(), file->Count());
    for (const TARN_MEDIA_INFO &s : file->songs)
        PrintInfo(s);
    delete file;
    return 0;
}

// smart list: every smart playlist with its match mode and rules.
static int SmartList(MediaLib &lib)
{
    std::vector<SmartPlaylist> lists;
    if (lib.ListSmart(&lists) != 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return 1;
    }
    for (const SmartPlaylist &p : lists) {
        printf("%s\t%s", p.name.c_str(), p.matchAny ? "any" : "all");
        for (const SmartRule &r : p.rules)
            printf("\t%s", SmartRuleText(r).c_str());
        printf("\n");
    }
    return 0;
}

// smart show NAME: the songs the playlist matches.
static int SmartShow(MediaLib &lib, const char *name)
{
    SmartPlaylist p;
    int rc = lib.FindSmart(name, &p);
    if (rc != 1) {
        fprintf(stderr, "tarnlib: %s\n",
                rc == 0 ? (std::string("no smart playlist named \"") + name + "\"").c_str()
                        : lib.LastError().c_str());
        return 1;
    }
    std::vector<MediaSong> songs;
    int total = 0;
    if (lib.SmartSongs(p, &songs, 0, 0, &total) != 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return 1;
    }
    printf("# %s: %d songs\n", p.name.c_str(), total);
    for (const MediaSong &s : songs)
        PrintSong(s);
    return 0;
}

// smart create NAME [--any] RULE...: argv[0] is "create".
static int SmartCreate(MediaLib &lib, int argc, char **argv)
{
    SmartPlaylist p;
    p.name = argv[1];
    for (int i = 2; i < argc; i++) {
        if (strcmp(argv[i], "--any") == 0) {
            p.matchAny = true;
            continue;
        }
        SmartRule r;
        std::string why;
        if (SmartRuleParse(argv[i], &r, &why) != 0) {
            fprintf(stderr, "tarnlib: bad rule \"%s\": %s\n", argv[i], why.c_str());
            return 2;
        }
        p.rules.push_back(r);
    }
    if (lib.SaveSmart(p) != 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return 1;
    }
    printf("Smart playlist \"%s\" saved with %zu rules\n", p.name.c_str(), p.rules.size());
    return 0;
}

// smart delete NAME.
static int SmartDelete(MediaLib &lib, const char *name)
{
    int rc = lib.DeleteSmart(name);
    if (rc < 0) {
        fprintf(stderr, "tarnlib: %s\n", lib.LastError().c_str());
        return 1;
    }
    if (rc == 0) {
        fprintf(stderr, "tarnlib: no smart playlist named \"%s\"\n", name);
        return 1;
    }
    printf("Smart playlist \"%s\" deleted\n", name);
    return 0;
}

static int CmdSmart(int argc, char **argv)
{
    if (argc < 1) {
        Usage();
        return 2;
    }
    std::string sub = argv[0];
    MediaLib lib;
    if (OpenLib(lib, sub == "create") != 0)
        return 1;
    if (sub == "list")
        return SmartList(lib);
    if (sub == "show" && argc == 2)
        return SmartShow(lib, argv[1]);
    if (sub == "create" && argc >= 3)
        return SmartCreate(lib, argc, argv);
    if (sub == "delete" && argc == 2)
        return SmartDelete(lib, argv[1]);
    Usage();
    return 2;
}

static int CmdCustom(int argc, char **argv)
{
    if (argc == 2 && strcmp(argv[0], "show") == 0) {
        std::string type, second, third;
        if (TARNAudioCustomGet((int)strtol(argv[1], nullptr, 10), type, second, third) != 0) {
            fprintf(stderr, "tarnlib: custom slot %s is empty\n", argv[1]);
            return 1;
        }
        printf("type=%s\nsecond=%s\nthird=%s\n", type.c_str(), second.c_str(), third.c_str());
        return 0;
    }
    if (argc == 5 && strcmp(argv[0], "set") == 0) {
        std::string type = argv[2];
        if (type != "playlist" && type != "smart" && type != "radio") {
            fprintf(stderr, "tarnlib: custom slot type must be playlist, smart or radio\n");
            return 2;
        }
        if (TARNAudioCustomSet((int)strtol(argv[1], nullptr, 10), type, argv[3], argv[4]) != 0) {
            fprintf(stderr, "tarnlib: cannot store custom slot %s (see the log)\n", argv[1]);
            return 1;
        }
        printf("Custom slot %s stored\n", argv[1]);
        return 0;
    }
    Usage();
    return 2;
}

int main(int argc, char **argv)
{
    int i = 1;
    while (i < argc && argv[i][0] == '-') {
        if (strcmp(argv[i], "--db") == 0 && i + 1 < argc) {
            MediaLibSetDefaultPath(argv[i + 1]);
            i += 2;
        } else if (strcmp(argv[i], "-h") == 0 || strcmp(argv[i], "--help") == 0) {
            Usage(stdout);
            return 0;
        } else if (strcmp(argv[i], "-V") == 0 || strcmp(argv[i], "--version") == 0) {
            printf("tarnlib %s\n", TARN_VERSION);
            return 0;
        } else {
            fprintf(stderr, "tarnlib: unknown option '%s'\n", argv[i]);
            Usage();
            return 2;
        }
    }
    if (i >= argc) {
        Usage();
        return 2;
    }
    std::string cmd = argv[i];
    int rest = argc - i - 1;
    char **args = argv + i + 1;
    if (cmd == "scan")
        return CmdScanAll(rest, args);
    if (cmd == "songs" && rest == 0)
        return CmdSongs();
    if (cmd == "playlists" && rest == 0)
        return CmdPlaylists();
    if (cmd == "playlist" && rest == 2 && strcmp(args[0], "show") == 0)
        return CmdPlaylistShow(args[1]);
    if (cmd == "smart")
        return CmdSmart(rest, args);
    if (cmd == "custom")
        return CmdCustom(rest, args);
    Usage();
    return 2;
}
