// The local player's side of the mplayer-daemon process: starting and
// ending it, its connection, and the commands sent over it.
#include "player/localplayer.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include "audio/info.h"
#include "platform/tarn_clock.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_proc.h"
#include "player/playlist.h"

static const char kLogUnit[] = "localplayer";

namespace {

// How long a command may wait for the connection to become writable.
const long kWritableWaitUsec = 1000;
const char kNeutralEqualizer[] = "0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0";
// How long a started player process may take to connect (a first start
// builds GStreamer's plugin registry) before another start replaces it.
const int64_t kConnectWaitMs = 10000;
// How long it may take to write its pid file.
const int64_t kPidFileWaitMs = 2000;

}  // namespace

std::string LocalPlayer::LoadFileCommand(const std::string &uri)
{
    // Backslashes are doubled; a double quote goes through as it is.
    std::string cmd = "loadfile \"";
    for (char c : uri) {
        if (c == '\\') {
            cmd += "\\\\";
        } else if (c == '"') {
            cmd += '"';
        } else {
            cmd += c;
        }
    }
    cmd += '"';
    return cmd;
}

int LocalPlayer::AttachMplayerFd(int fd)
{
    if (fd < 0)
        return -1;
    // A new connection replaces one left behind by an earlier process.
    if (mplayerFd >= 0 && mplayerFd != fd)
        close(mplayerFd);
    mplayerFd = fd;
    // A new process counts its failure reports from 0.
    failSerialSeen = 0;
    startedAtMs = 0;
    if (!pendingUri.empty()) {
        std::string uri;
        uri.swap(pendingUri);
        if (LoadFile(uri) != 0)
            TLOG("Failed to load file [%s]", uri.c_str());
    }
    return 0;
}

int LocalPlayer::SendCommand(const char *bytes, size_t length)
{
    if (!bytes || length == 0 || static_cast<ssize_t>(length) <= 0) {
        TLOG("Bad parameters.");
        return -1;
    }
    // With no player running the command has nowhere to go; it counts as sent.
    if (!IsMplayerAlive())
        return 0;

    bool writable = false;
    if (mplayerFd >= 0 && mplayerFd < FD_SETSIZE) {
        fd_set wfds;
        FD_ZERO(&wfds);
        FD_SET(mplayerFd, &wfds);
        struct timeval tv;
        tv.tv_sec = 0;
        tv.tv_usec = kWritableWaitUsec;
        int n;
        do {
            n = select(mplayerFd + 1, nullptr, &wfds, nullptr, &tv);
        } while (n < 0 && errno == EINTR);
        writable = n > 0 && FD_ISSET(mplayerFd, &wfds);
    }
    if (!writable) {
        TLOG("MPlayer fd is not writable now");
        return -1;
    }

    // Never block here and never raise SIGPIPE: a hung or vanished player
    // must not hold up the daemon's loop.
    ssize_t n = send(mplayerFd, bytes, length, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n < 0 && errno == ENOTSOCK)
        n = write(mplayerFd, bytes, length);
    if (n < 0 || static_cast<size_t>(n) != length) {
        TLOG("Failed to send action to mplayer. fd=%d. (%m)", mplayerFd);
        return -1;
    }
    return 0;
}

int LocalPlayer::SendPadded(const char *text)
{
    char buffer[kPaddedCommandSize];
    memset(buffer, 0, sizeof(buffer));
    snprintf(buffer, sizeof(buffer), "%s", text);
    return SendCommand(buffer, sizeof(buffer));
}

bool LocalPlayer::IsMplayerAlive()
{
    return TLIBCProcAliveByPidFile(TarnPath(TARN_MPLAYER_PID_FILE).c_str()) == 1;
}

void LocalPlayer::KillMplayer()
{
    TLIBCProcSignalByPidFile(TarnPath(TARN_MPLAYER_PID_FILE).c_str(), SIGTERM);
    CloseMplayerFd();
    startedAtMs = 0;
    pendingUri.clear();
}

void LocalPlayer::KillByName()
{
    TLIBCKill("mplayer-daemon", 0);
    CloseMplayerFd();
    startedAtMs = 0;
    pendingUri.clear();
}

void LocalPlayer::CloseMplayerFd()
{
    if (mplayerFd >= 0) {
        close(mplayerFd);
        mplayerFd = -1;
    }
}

int LocalPlayer::StartMplayer(const std::string &uri)
{
    if (IsMplayerAlive())
        KillMplayer();
    // Whatever connection is left belongs to a process that is gone; the new
    // one connects by itself and reaches AttachMplayerFd.
    CloseMplayerFd();

    char gains[256];
    gains[0] = '\0';
    if (EqDefaultProfileGet(gains, sizeof(gains)) < 1)
        snprintf(gains, sizeof(gains), "%s", kNeutralEqualizer);
    for (char *p = gains; *p; ++p) {
        if (*p == ' ')
            *p = ':';
    }
    // The filter argument holds at most 255 characters.
    std::string filter = std::string("equalizer=") + gains;
    if (filter.size() > 255)
        filter.resize(255);
    char volumeText[16];
    snprintf(volumeText, sizeof(volumeText), "%d", volume);

    std::string exe = TarnPath(TARN_MPLAYER_BIN);
    std::vector<std::string> args = {exe, uri, "-loop", "0", "-daemon", "-volume", volumeText,
                                     "-af", filter};
    std::vector<char *> argv;
    for (std::string &a : args)
        argv.push_back(&a[0]);
    argv.push_back(nullptr);
    pendingUri.clear();
    if (TLIBCExecv(exe.c_str(), argv.data(), 1) == -1) {
        TLOG("Failed to start MPlayer");
        SetError("cannot start the player program " + exe);
        startedAtMs = 0;
        return -1;
    }
    startedAtMs = TarnNowMs();
    return 0;
}

int LocalPlayer::LoadFile(const std::string &uri)
{
    std::string cmd = LoadFileCommand(uri);
    if (SendCommand(cmd.data(), cmd.size()) != 0) {
        TLOG("Failed to send action [%s]", cmd.c_str());
        return -1;
    }
    return 0;
}

void LocalPlayer::OnMplayerClosed()
{
    if (mplayerFd < 0)
        return;
    CloseMplayerFd();
    TLOG("mplayer-daemon ended while playing [%s]", currentUri.c_str());
    SetError("the player program ended unexpectedly");
    muted = false;
    state = PLAYER_STATE_STOPPED;
    // It is our child when we started it: collect its exit status.
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
}

bool LocalPlayer::StartPending()
{
    if (mplayerFd >= 0 || startedAtMs == 0)
        return false;
    int64_t age = TarnNowMs() - startedAtMs;
    // The process writes its pid file first thing; past the first moments
    // one that is not alive ended before it connected.
    return age < kConnectWaitMs && (age < kPidFileWaitMs || IsMplayerAlive());
}

void LocalPlayer::SaveVolumeAndKill()
{
    if (VolumeConfSet(volume) == -1)
        TLOG("Failed to save AS_Player_Volume=%s to conf", std::to_string(volume).c_str());
    KillMplayer();
}
