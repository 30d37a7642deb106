#include "daemon/tarnaudiod.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <string>
#include <poll.h>
#include <sys/stat.h>
#include <sys/socket.h>
#include <unistd.h>

#include "daemon/access.h"
#include "daemon/globals.h"
#include "daemon/shm.h"
#include "daemon/socket.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_proc.h"
#include "player/localplayer.h"
#include "player/upnpplayer.h"
#include "upnp/upnp.h"

static const char kLogUnit[] = "tarnaudiod";

// Set by --foreground (DaemonSetForeground).
static int g_foreground = 0;

// ---------------------------------------------------------------------------
// Process start-up, loop and shutdown (control requests: dispatch.cpp).

// The self-pipe that wakes the loop's wait when SIGTERM arrives or the
// control point has news for the renderer players.
static int g_wakePipe[2] = {-1, -1};

static void DaemonWake()
{
    if (g_wakePipe[1] >= 0) {
        ssize_t w = write(g_wakePipe[1], "u", 1);
        (void)w;  // a full pipe already wakes the loop
    }
}

void DaemonOnSigterm(int)
{
    int saved = errno;
    g_running = 0;
    if (g_wakePipe[1] >= 0) {
        ssize_t w = write(g_wakePipe[1], "t", 1);
        (void)w;  // a full pipe already wakes the loop
    }
    errno = saved;
}

int DaemonSetupSignals()
{
    if (signal(SIGPIPE, SIG_IGN) == SIG_ERR) {
        TarnLog("%s:%d Failed to signal()", kLogUnit, 44);
        return -1;
    }
    if (g_wakePipe[0] < 0 && pipe2(g_wakePipe, O_CLOEXEC | O_NONBLOCK) != 0) {
        TarnLog("%s:%d Failed to create the wake-up pipe, %m", kLogUnit, 47);
        return -1;
    }
    if (signal(SIGTERM, DaemonOnSigterm) == SIG_ERR) {
        TarnLog("%s:%d Failed to signal()", kLogUnit, 49);
        return -1;
    }
    // SIGTERM was held back while the process was being set up (see
    // DaemonInit); one that arrived meanwhile is delivered now.
    sigset_t term;
    sigemptyset(&term);
    sigaddset(&term, SIGTERM);
    sigprocmask(SIG_UNBLOCK, &term, nullptr);
    return 0;
}

int DaemonInit()
{
    // Hold SIGTERM until its handler is installed, so that a stop request
    // during start-up always ends in an orderly shutdown.
    sigset_t term;
    sigemptyset(&term);
    sigaddset(&term, SIGTERM);
    sigprocmask(SIG_BLOCK, &term, nullptr);

    std::string pidFile = TarnPath(TARN_PID_FILE);
    int pid = TLIBCReadPidFile(pidFile.c_str());
    if (pid > 0 && pid != getpid() && TLIBCProcAlive(pid)) {
        printf("Audio daemon already exists. Pid[%d]\n", pid);
        fflush(stdout);
        TarnLog("%s:%d Audio daemon already exists. Pid[%d]", kLogUnit, 67, pid);
        exit(0);
    }
    if (!g_foreground && daemon(0, 0) != 0) {
        printf("Failed to daemon()\n");
        fflush(stdout);
        TarnLog("%s:%d Failed to daemon()", kLogUnit, 75);
        return -1;
    }
    if (TLIBCProcPidFileCreate(pidFile.c_str()) != 0) {
        TarnLog("%s:%d Failed to write pid.", kLogUnit, 81);
        return -1;
    }
    if (DaemonSetupSignals() != 0) {
        TarnLog("%s:%d Failed to setup signal handler.", kLogUnit, 86);
        return -1;
    }
    if (g_foreground)
        signal(SIGINT, DaemonOnSigterm);
    return 0;
}

void DaemonSetForeground(int on)
{
    g_foreground = on;
    TarnLogToStderr(on != 0);
}

int DaemonStart(DaemonContext &ctx)
{
    std::string mplayerPath = TarnPath(TARN_MPLAYER_SOCKET);
    // The player socket is the daemon user's alone; the control socket and
    // the segments are shared with the audio group.
    gid_t group = AccessGroup();
    mode_t mask = umask(ACCESS_MPLAYER_UMASK);
    ctx.mplayerListenFd = SocketListen(mplayerPath.c_str(), 1);
    umask(mask);
    if (ctx.mplayerListenFd == -1) {
        TarnLog("%s:%d Failed to init socket %s, %m", kLogUnit, 456, mplayerPath.c_str());
        return -1;
    }
    fcntl(ctx.mplayerListenFd, F_SETFD, FD_CLOEXEC);
    std::string ctrlPath = TarnPath(TARN_CTRL_SOCKET);
    mask = umask(ACCESS_CTRL_UMASK);
    ctx.ctrlListenFd = SocketListen(ctrlPath.c_str(), 5);
    umask(mask);
    if (ctx.ctrlListenFd == -1) {
        TarnLog("%s:%d Failed to init socket %s, %m", kLogUnit, 462, ctrlPath.c_str());
        return -1;
    }
    AccessShareSocket(ctrlPath.c_str(), group);
    fcntl(ctx.ctrlListenFd, F_SETFD, FD_CLOEXEC);
    fcntl(ctx.ctrlListenFd, F_SETFL, fcntl(ctx.ctrlListenFd, F_GETFL) | O_NONBLOCK);
    ctx.controller = new UpnpController();
    if (ctx.controller->Init() != 0) {
        TarnLog("%s:%d Failed to init Upnp Controller", kLogUnit, 471);
        return -1;
    }
    ctx.controller->SetWakeup(DaemonWake);
    ctx.localPlayer = new LocalPlayer();
    ctx.playerShm = static_cast<PlayerStatusShm *>(
        ShmCreateAttach(TarnShmKeyPlayer(), TARN_SHM_PLAYER_SIZE, 1));
    if (!ctx.playerShm) {
        TarnLog("%s:%d Failed to create shared memory. (%m)", kLogUnit, 483);
        return -1;
    }
    ctx.publishedShm = static_cast<PublishedStatusShm *>(
        ShmCreateAttach(TarnShmKeyPublished(), TARN_SHM_PUBLISHED_SIZE, 1));
    if (!ctx.publishedShm) {
        TarnLog("%s:%d Failed to create shared memory. (%m)", kLogUnit, 490);
        return -1;
    }
    AccessShareSegment(ctx.playerShm, TarnShmKeyPlayer(), group);
    AccessShareSegment(ctx.publishedShm, TarnShmKeyPublished(), group);
    // Devices already on the network answer the short searches within a
    // second; the long ones are the searches of old.
    ctx.controller->SearchQuick();
    ctx.controller->SearchServers();
    ctx.controller->SearchRenderers();
    return 0;
}

namespace {

// The nearest of two timeouts in ms (-1: none).
int Sooner(int a, int b)
{
    if (a < 0)
        return b;
    if (b < 0)
        return a;
    return a < b ? a : b;
}


// Sleeps until something is to be done; returns what poll saw.
void WaitForWork(DaemonContext &ctx, std::vector<struct pollfd> &fds, size_t *connsFirst)
{
    fds.clear();
    fds.push_back(pollfd{g_wakePipe[0], POLLIN, 0});
    fds.push_back(pollfd{ctx.mplayerListenFd, POLLIN, 0});
    // Once SIGTERM arrived no connection is taken, but those held are still
    // answered (until their deadlines).
    bool accepting = g_running && ctx.conns.Count() < CTRL_CONNS_MAX;
    fds.push_back(pollfd{ctx.ctrlListenFd, static_cast<short>(accepting ? POLLIN : 0), 0});
    fds.push_back(pollfd{ctx.localPlayer->GetMplayerFd(), POLLIN, 0});
    *connsFirst = fds.size();
    ctx.conns.AddPollFds(fds);

    int timeout = ctx.conns.TimeoutMs();
    timeout = Sooner(timeout, ctx.localPlayer->PollIntervalMs());
    if (!ctx.upnpPlayers.empty())
        timeout = Sooner(timeout, DAEMON_RENDERER_POLL_MS);
    if (!g_running)
        timeout = ctx.conns.TimeoutMs();
    int n = poll(fds.data(), fds.size(), timeout);
    if (n < 0) {
        for (struct pollfd &p : fds)
            p.revents = 0;  // EINTR: a signal; the turn goes on
    }
    if (fds[0].revents) {
        char drain[64];
        while (read(g_wakePipe[0], drain, sizeof(drain)) > 0) {
        }
    }
}

}  // namespace

// Renderer players: drop those whose renderer left, follow index moves,
// poll the rest.
static void PollRenderers(DaemonContext &ctx)
{
    UpnpController *controller = ctx.controller;
    std::vector<UpnpPlayer *> &players = ctx.upnpPlayers;
    controller->Lock();
    time_t now = time(nullptr);
    for (size_t i = 0; i < players.size();) {
        UpnpPlayer *player = players[i];
        int index = controller->FindRendererByUdn(player->GetUdn());
        if (index == -1) {
            // The renderer left: its player and queue are kept for a while,
            // should it come back (a restart, a short loss of the network).
            if (!player->IsGone()) {
                bool selected = !g_localSelected && player->GetRendererIndex() == g_selectedRenderer;
                if (player->GetRendererIndex() == g_selectedRenderer)
                    g_selectedRenderer = -1;
                player->OnRendererGone(selected);
                if (!g_localSelected)
                    g_changed = 1;
            } else if (now - player->GoneSince() >= DAEMON_RENDERER_KEEP_SECONDS) {
                delete player;
                players.erase(players.begin() + static_cast<long>(i));
                continue;
            }
            ++i;
            continue;
        }
        if (player->IsGone()) {
            player->OnRendererBack(index);
            // It was playing for the user, and nothing else was chosen since.
            if (player->WasSelected() && !g_localSelected && g_selectedRenderer == -1) {
                g_selectedRenderer = index;
                g_changed = 1;
            }
        }
        if (index != player->GetRendererIndex()) {
            if (player->GetRendererIndex() == g_selectedRenderer)
                g_selectedRenderer = index;
            player->SetRendererIndex(index);
            if (!g_localSelected)
                g_changed = 1;
        }
        controller->SelectRenderer(static_cast<unsigned>(index));
        player->Poll();
        ++i;
    }
    if (!g_localSelected && g_selectedRenderer != -1)
        controller->SelectRenderer(static_cast<unsigned>(g_selectedRenderer));
    controller->Unlock();
}

// The status of the selected player into the published segment.
static void PublishSelected(DaemonContext &ctx)
{
    std::vector<UpnpPlayer *> &players = ctx.upnpPlayers;
    if (g_localSelected) {
        ctx.localPlayer->PublishStatus(ctx.publishedShm);
    } else if (g_selectedRenderer != -1) {
        UpnpPlayer *selected = FindPlayerByIndex(players, g_selectedRenderer);
        if (selected)
            selected->PublishStatus(ctx.publishedShm);
        else
            memset(ctx.publishedShm, 0, TARN_SHM_PUBLISHED_SIZE);
    } else {
        // The selected renderer left: nothing plays (the changed flag stays).
        int32_t changed = ctx.publishedShm->changed;
        memset(ctx.publishedShm, 0, TARN_SHM_PUBLISHED_SIZE);
        ctx.publishedShm->changed = changed;
    }
}

void DaemonLoopTurn(DaemonContext &ctx)
{
    std::vector<struct pollfd> fds;
    size_t connsFirst = 0;
    WaitForWork(ctx, fds, &connsFirst);

    if (fds[1].revents) {
        int fd = SocketAcceptPoll(ctx.mplayerListenFd);
        if (fd >= 0)
            ctx.localPlayer->AttachMplayerFd(fd);
    }
    // mplayer-daemon never writes on its connection: readable means closed.
    if (fds[3].fd >= 0 && fds[3].fd == ctx.localPlayer->GetMplayerFd() && fds[3].revents) {
        char byte;
        ssize_t r = recv(fds[3].fd, &byte, 1, MSG_DONTWAIT);
        if (r == 0 || (r < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR))
            ctx.localPlayer->OnMplayerClosed();
    }

    ctx.conns.TakeReady(fds, connsFirst);
    int ready = ctx.conns.NextReadable();
    if (ready >= 0)
        ServeRequest(ctx, ready);
    ctx.conns.Service();
    if (fds[2].revents)
        ctx.conns.AcceptAll(ctx.ctrlListenFd);

    // Local playback goes on while a renderer is selected.
    ctx.localPlayer->Poll(ctx.playerShm);

    PollRenderers(ctx);

    ctx.publishedShm->changed = g_changed;

    PublishSelected(ctx);
}

int DaemonShutdown(DaemonContext &ctx)
{
    TarnLog("%s:%d tarnaudiod exit", kLogUnit, 530);
    ctx.conns.CloseAll();
    if (ctx.ctrlListenFd >= 0) {
        close(ctx.ctrlListenFd);
        unlink(TarnPath(TARN_CTRL_SOCKET).c_str());
        ctx.ctrlListenFd = -1;
    }
    // The mplayer listening socket stays open and its file stays; the next
    // start unlinks the path before binding.
    if (ctx.localPlayer) {
        ctx.localPlayer->SaveVolumeAndKill();
        delete ctx.localPlayer;
        ctx.localPlayer = nullptr;
    }
    for (UpnpPlayer *player : ctx.upnpPlayers)
        delete player;
    ctx.upnpPlayers.clear();
    if (ctx.playerShm) {
        // Bytes 0 to 4103 belong to mplayer-daemon and stay as they are.
        memset(reinterpret_cast<char *>(ctx.playerShm) + 4104, 0, TARN_SHM_PLAYER_SIZE - 4104);
        ShmDetach(ctx.playerShm);
        ctx.playerShm = nullptr;
    }
    if (ctx.publishedShm) {
        memset(ctx.publishedShm, 0, TARN_SHM_PUBLISHED_SIZE);
        ShmDetach(ctx.publishedShm);
        ctx.publishedShm = nullptr;
    }
    if (ctx.controller) {
        ctx.controller->Uninit();
        delete ctx.controller;
        ctx.controller = nullptr;
    }
    unlink(TarnPath(TARN_PID_FILE).c_str());
    return 0;
}

int DaemonRun()
{
    TarnLogOpen("tarnaudiod");
    DaemonContext ctx;
    if (DaemonInit() != 0) {
        TarnLog("%s:%d Failed to init daemon.", kLogUnit, 450);
        return DaemonShutdown(ctx);
    }
    if (DaemonStart(ctx) != 0 || !g_running)
        return DaemonShutdown(ctx);
    do {
        DaemonLoopTurn(ctx);
    } while (g_running || ctx.conns.Count() > 0);
    return DaemonShutdown(ctx);
}
