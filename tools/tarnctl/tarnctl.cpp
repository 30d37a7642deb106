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
#include "tools/tarnctl/commands.h"
#include "tools/tarnctl/library.h"
#include "tools/tarnctl/text.h"


namespace fs = std::filesystem;

using namespace tarnctl;

namespace {

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
