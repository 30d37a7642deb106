// mplayer-daemon: the media player process that tarnaudiod starts for its
// local sound output.
//
//   mplayer-daemon URI -loop 0 -daemon -volume N -af equalizer=g1:...:g10
//
// It writes its pid file, connects back to the daemon's socket, plays the
// URI and then every URI that "loadfile" names, and obeys the commands
// described in command_parser.h. What it plays and how far it got is
// reported in the player status segment. "quit", SIGTERM, SIGINT or the
// daemon closing the connection end it cleanly (pid file removed, WAV output
// completed). The process stays in the foreground; whoever starts it does
// not wait for it.
#include "daemon/tarn_types.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tarn_version.h"
#include "tools/mplayer-daemon/command_parser.h"
#include "tools/mplayer-daemon/playbin_player.h"
#include "tools/mplayer-daemon/status_segment.h"

#include <glib-unix.h>
#include <gst/gst.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>
#include <vector>

static const char kLogUnit[] = "mplayer-daemon";

namespace {

// Connecting to the daemon is retried this often before playing on without
// commands.
const guint kConnectRetryMs = 100;
const int kConnectTries = 50;

struct App {
    GMainLoop *loop = nullptr;
    PlaybinPlayer *player = nullptr;
    MplayerCommandParser parser;
    int fd = -1;
    guint watch = 0;
    guint connectTimer = 0;
    int connectTries = 0;
    std::string socketPath;
};

void MakeParentDirs(const std::string &path)
{
    size_t slash = path.rfind('/');
    if (slash == std::string::npos || slash == 0)
        return;
    std::string dir = path.substr(0, slash);
    for (size_t i = 1; i <= dir.size(); ++i) {
        if (i == dir.size() || dir[i] == '/') {
            std::string part = dir.substr(0, i);
            mkdir(part.c_str(), 0755);
        }
    }
}

int WritePidFile(const std::string &path)
{
    MakeParentDirs(path);
    FILE *f = fopen(path.c_str(), "w");
    if (!f) {
        TLOG("Failed to write pid file [%s]. (%m)", path.c_str());
        return -1;
    }
    fprintf(f, "%d\n", static_cast<int>(getpid()));
    if (fclose(f) != 0) {
        TLOG("Failed to write pid file [%s]. (%m)", path.c_str());
        return -1;
    }
    return 0;
}

// Removes the pid file unless another instance has written its own since.
void RemovePidFile(const std::string &path)
{
    FILE *f = fopen(path.c_str(), "r");
    if (!f)
        return;
    int pid = 0;
    int n = fscanf(f, "%d", &pid);
    fclose(f);
    if (n == 1 && pid == static_cast<int>(getpid()))
        unlink(path.c_str());
}

// The GStreamer registry lives under HOME; without one it goes under the
// run root so that it is built once and reused.
void SetUpRegistry()
{
    if (!TarnEnvGet("GST_REGISTRY").empty() || !TarnEnvGet("HOME").empty())
        return;
    std::string path = TarnPath("/var/cache/mplayer-daemon/gst-registry.bin");
    MakeParentDirs(path);
    setenv("GST_REGISTRY", path.c_str(), 1);
}

void Execute(App *app, const MplayerCommand &cmd)
{
    switch (cmd.type) {
    case MPCMD_PAUSE:
        app->player->TogglePause();
        break;
    case MPCMD_QUIT:
        g_main_loop_quit(app->loop);
        break;
    case MPCMD_LOADFILE:
        app->player->Load(cmd.uri);
        break;
    case MPCMD_SEEK:
        app->player->SeekRelative(cmd.value);
        break;
    case MPCMD_SETVOL:
        app->player->SetVolume(cmd.value);
        break;
    case MPCMD_MUTE:
        app->player->ToggleMute();
        break;
    case MPCMD_SETEQU:
        app->player->SetEqualizer(cmd.gains);
        break;
    default:
        break;
    }
}

gboolean OnCommandData(gint fd, GIOCondition cond, gpointer p)
{
    App *app = static_cast<App *>(p);
    std::vector<MplayerCommand> cmds;
    bool closed = false;
    size_t garbageBefore = app->parser.GarbageBytes();
    char buf[4096];
    for (;;) {
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n > 0) {
            app->parser.Feed(buf, static_cast<size_t>(n), &cmds);
            continue;
        }
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            break;
        if (n < 0)
            TLOG("Failed to read commands from the daemon. (%m)");
        closed = true;
        break;
    }
    // Everything the daemon wrote so far has been read.
    app->parser.Flush(&cmds);
    size_t garbage = app->parser.GarbageBytes() - garbageBefore;
    if (garbage > 0)
        TLOG("Skipped %d bytes that are not a command.", static_cast<int>(garbage));
    for (const MplayerCommand &cmd : cmds) {
        Execute(app, cmd);
        if (cmd.type == MPCMD_QUIT)
            break;
    }
    if (closed) {
        // Only the daemon can command this process: without the connection
        // nobody could stop it any more.
        app->watch = 0;
        close(app->fd);
        app->fd = -1;
        g_main_loop_quit(app->loop);
        return G_SOURCE_REMOVE;
    }
    return G_SOURCE_CONTINUE;
}

int TryConnect(App *app)
{
    // Non-blocking from the start: a daemon whose listen queue is full must
    // not hold up this process (the connect is retried later).
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0)
        return -1;
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof(addr));
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", app->socketPath.c_str());
    if (connect(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) != 0) {
        close(fd);
        return -1;
    }
    app->fd = fd;
    app->watch = g_unix_fd_add(fd, static_cast<GIOCondition>(G_IO_IN | G_IO_HUP | G_IO_ERR),
                               &OnCommandData, app);
    return 0;
}

gboolean OnConnectRetry(gpointer p)
{
    App *app = static_cast<App *>(p);
    if (TryConnect(app) == 0) {
        app->connectTimer = 0;
        return G_SOURCE_REMOVE;
    }
    if (++app->connectTries >= kConnectTries) {
        TLOG("Failed to connect to [%s]; playing on without commands. (%m)",
             app->socketPath.c_str());
        app->connectTimer = 0;
        return G_SOURCE_REMOVE;
    }
    return G_SOURCE_CONTINUE;
}

gboolean OnQuitSignal(gpointer p)
{
    g_main_loop_quit(static_cast<App *>(p)->loop);
    return G_SOURCE_CONTINUE;
}

}  // namespace

int main(int argc, char **argv)
{
    // --help, --version and unknown double-dash options are answered before
    // anything happens; single-dash options the daemon may pass are ignored.
    for (int i = 1; i < argc; ++i) {
        if (!strcmp(argv[i], "--help") || !strcmp(argv[i], "-h")) {
            printf("usage: mplayer-daemon [URI] [-loop N] [-daemon] [-volume N] [-af equalizer=G1:...:G10]\n"
                   "       mplayer-daemon --help | --version\n"
                   "The player process of tarnaudiod: plays URI, takes commands on /tmp/mplayer.sock\n"
                   "and reports in the player status segment. See mplayer-daemon(8).\n");
            return 0;
        }
        if (!strcmp(argv[i], "--version") || !strcmp(argv[i], "-V")) {
            printf("mplayer-daemon %s\n", TARN_VERSION);
            return 0;
        }
        if (!strncmp(argv[i], "--", 2)) {
            fprintf(stderr, "mplayer-daemon: unknown option '%s' (see --help)\n", argv[i]);
            return 2;
        }
    }
    TarnLogOpen("mplayer-daemon");
    signal(SIGPIPE, SIG_IGN);

    MplayerArgs args;
    if (MplayerParseArgs(argc, argv, &args) != 0)
        TLOG("An option lacks its value; it is ignored.");

    // From before the pid file names this process, a SIGTERM ends it
    // through the main loop, also while GStreamer is still starting (the
    // first start builds its registry), so that the pid file never stays
    // behind.
    App app;
    app.loop = g_main_loop_new(nullptr, FALSE);
    g_unix_signal_add(SIGTERM, &OnQuitSignal, &app);
    g_unix_signal_add(SIGINT, &OnQuitSignal, &app);
    g_unix_signal_add(SIGHUP, &OnQuitSignal, &app);

    // Early, so that the daemon sees this process as alive at once.
    const std::string pidPath = TarnPath(TARN_MPLAYER_PID_FILE);
    WritePidFile(pidPath);

    SetUpRegistry();
    gst_init(nullptr, nullptr);

    StatusSegment segment;
    segment.Attach(TarnShmKeyPlayer());
    segment.SetPid(static_cast<int>(getpid()));
    segment.ClearFailures();

    PlaybinPlayer player(&segment);
    app.player = &player;
    if (player.Init(TarnAudioOut(), args.volume, args.gains) != 0) {
        TLOG("Failed to set up the audio output [%s].", TarnAudioOut().c_str());
        RemovePidFile(pidPath);
        return 1;
    }

    app.socketPath = TarnPath(TARN_MPLAYER_SOCKET);
    if (TryConnect(&app) != 0)
        app.connectTimer = g_timeout_add(kConnectRetryMs, &OnConnectRetry, &app);

    if (!args.uri.empty())
        player.Load(args.uri);

    g_main_loop_run(app.loop);

    player.Shutdown();
    if (app.connectTimer)
        g_source_remove(app.connectTimer);
    if (app.watch)
        g_source_remove(app.watch);
    if (app.fd >= 0)
        close(app.fd);
    segment.Detach();
    RemovePidFile(pidPath);
    g_main_loop_unref(app.loop);
    return 0;
}
