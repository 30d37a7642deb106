// The local output player: plays the local queue by starting mplayer-daemon,
// commanding it over the connection it opens back to /tmp/mplayer.sock and
// following its reports in the player status segment.
#include "player/localplayer.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <climits>
#include <cstring>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <ctime>
#include <unistd.h>

#include "audio/info.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_proc.h"
#include "player/playlist_actions.h"

static const char kLogUnit[] = "localplayer";

namespace {

// Commands with a value travel in a fixed buffer of this size, NUL-padded.
const size_t kPaddedCommandSize = 2048;
// How long a command may wait for the connection to become writable.
const long kWritableWaitUsec = 1000;
// How often the hardware mixer volume is re-read, in seconds.
const time_t kVolumeCheckSeconds = 6;
const char kNeutralEqualizer[] = "0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0 0.0";

// Copies a NUL-terminated text out of a fixed field of a shared segment that
// another process may be rewriting: never reads past the field.
std::string FieldText(const char *field, size_t size)
{
    return std::string(field, strnlen(field, size));
}

int ClampVolume(int v)
{
    if (v < 0)
        return 0;
    if (v > 100)
        return 100;
    return v;
}

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

namespace {

// How long a started player process may take to connect (a first start
// builds GStreamer's plugin registry) before another start replaces it.
const int64_t kConnectWaitMs = 10000;
// How long it may take to write its pid file.
const int64_t kPidFileWaitMs = 2000;

int64_t MonotonicMs()
{
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

}  // namespace

LocalPlayer::LocalPlayer()
    : state(PLAYER_STATE_NONE),
      playlist(new Playlist()),
      duration(-1),
      position(-1),
      mplayerFd(-1),
      lastVolumeCheck(time(nullptr)),
      volume(50),
      errorCount(0),
      failSerialSeen(0),
      failedInARow(0),
      muted(false),
      startedAtMs(0)
{
    int stored = VolumeConfGet();
    if (stored != -1)
        volume = stored;
}

LocalPlayer::~LocalPlayer()
{
    CloseMplayerFd();
    delete playlist;
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

int LocalPlayer::HandleAction(const ControlRequest *request, Json::Value &reply)
{
    if (!request) {
        TarnLog("%s:%d Bad parameter", kLogUnit, 523);
        return -1;
    }
    // The text parameter is NUL-terminated by the client; never read past
    // the request even when it is not.
    char text[CTRL_PARAM_SIZE + 1];
    memcpy(text, request->parameter, CTRL_PARAM_SIZE);
    text[CTRL_PARAM_SIZE] = '\0';

    switch (request->action) {
    case ACT_PLAY_PAUSE:
    case ACT_PLAY_INDEX:
    case ACT_NEXT:
    case ACT_PREVIOUS:
        // A play request starts afresh: earlier errors are history.
        lastError.clear();
        failedInARow = 0;
        break;
    default:
        break;
    }

    switch (request->action) {
    case ACT_PLAY_PAUSE:
        PlayPause();
        break;
    case ACT_STOP:
        Stop();
        break;
    case ACT_NEXT:
        Next(false);
        break;
    case ACT_PREVIOUS:
        Previous();
        break;
    case ACT_PLAY_INDEX:
        PlayIndex(text);
        break;
    case ACT_SEEK:
        Seek(text);
        break;
    case ACT_MUTE:
        Mute();
        break;
    case ACT_SET_VOLUME:
        SetVolume(static_cast<int>(strtol(text, nullptr, 10)));
        break;
    case ACT_VOLUME_UP:
        SetVolume(volume + 3);
        break;
    case ACT_VOLUME_DOWN:
        SetVolume(volume - 3);
        break;
    case ACT_GET_STATUS:
        GetStatusJson(reply);
        break;
    case ACT_QUEUE_ADD:
    case ACT_QUEUE_REMOVE:
    case ACT_QUEUE_CLEAR:
    case ACT_QUEUE_INSERT:
    case ACT_QUEUE_SET_CURRENT:
    case ACT_SET_REPEAT_MODE:
    case ACT_TOGGLE_SHUFFLE:
    case ACT_QUEUE_LIST:
    case ACT_CYCLE_REPEAT_MODE:
        PlaylistHandleAction(*playlist, request, reply);
        break;
    case ACT_SET_EQUALIZER:
        SetEqualizer(text);
        break;
    default:
        TarnLog("%s:%d Action [%d] not handled", kLogUnit, 576, request->action);
        return -1;
    }
    return 0;
}

// ---------------------------------------------------------------------------
// Commands to mplayer-daemon.

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
    startedAtMs = MonotonicMs();
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

// ---------------------------------------------------------------------------
// Player actions.

int LocalPlayer::PlayPause()
{
    if (mplayerFd != -1 && IsMplayerAlive()) {
        static const char kPause[] = "pause";
        if (SendCommand(kPause, sizeof(kPause) - 1) != 0) {
            TLOG("Failed to send action [%s]", kPause);
            return -1;
        }
        return 0;
    }
    // The process started a moment ago is still coming up: it plays.
    if (StartPending())
        return 0;
    std::string uri;
    if (playlist->GetCurrentUri(uri) != 0) {
        TLOG("Failed to get current song in playlist.");
        return -1;
    }
    if (StartMplayer(uri) != 0) {
        TLOG("Failed to Start MPlayer with uri [%s]", uri.c_str());
        return -1;
    }
    state = PLAYER_STATE_PLAYING;
    return 0;
}

int LocalPlayer::Stop()
{
    static const char kQuit[] = "quit";
    if (SendCommand(kQuit, sizeof(kQuit) - 1) != 0) {
        TLOG("Failed to send action [%s]", kQuit);
        return -1;
    }
    for (int i = 0; i < 10; ++i) {
        if (!IsMplayerAlive())
            break;
        usleep(100 * 1000);
    }
    if (IsMplayerAlive())
        KillMplayer();
    state = PLAYER_STATE_NONE;
    CloseMplayerFd();
    return 0;
}

int LocalPlayer::Step(bool forward, bool automatic)
{
    // Stepping works only while a song is playing.
    if (mplayerFd == -1 || !IsMplayerAlive())
        return 0;

    unsigned start = playlist->Current();
    for (;;) {
        std::string uri;
        int rc = forward ? playlist->Next(uri, automatic) : playlist->Previous(uri, automatic);
        if (rc != 0)
            break;
        if (AudioIsSupportedFile(1, uri.c_str())) {
            if (LoadFile(uri) != 0) {
                TLOG("Failed to load file [%s]", uri.c_str());
                return -1;
            }
            return 0;
        }
        // Skip a song the player cannot play, until the queue comes back
        // round to where it started.
        if (playlist->Current() == start) {
            SetError("no song of the queue can be played");
            break;
        }
    }
    Stop();
    return -1;
}

int LocalPlayer::Next(bool automatic)
{
    return Step(true, automatic);
}

int LocalPlayer::Previous()
{
    return Step(false, false);
}

int LocalPlayer::PlayIndex(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    long index = strtol(text, nullptr, 10);
    if (index < 0)
        index = 0;
    if (playlist->SetCurrent(static_cast<unsigned>(index)) != 0) {
        TLOG("Failed to set index [%d]", static_cast<int>(index));
        return -1;
    }
    std::string uri;
    if (playlist->GetCurrentUri(uri) != 0) {
        TLOG("Failed to get current song in playlist.");
        return -1;
    }
    if (mplayerFd != -1 && IsMplayerAlive()) {
        if (LoadFile(uri) != 0) {
            TLOG("Failed to load file [%s]", uri.c_str());
            return -1;
        }
        return 0;
    }
    if (StartPending()) {
        pendingUri = uri;
        state = PLAYER_STATE_PLAYING;
        return 0;
    }
    if (PlayPause() != 0) {
        TLOG("Failed to Start Mplayer");
        return -1;
    }
    return 0;
}

int LocalPlayer::Seek(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    long target = strtol(text, nullptr, 10);
    if (target < 0)
        target = 0;
    if (target > INT_MAX)
        target = INT_MAX;
    // mplayer-daemon takes the offset from where it last reported to be.
    // The difference is taken in 64 bits: a huge target must not overflow.
    long long offset = static_cast<long long>(target) - position;
    if (offset > INT_MAX)
        offset = INT_MAX;
    char cmd[64];
    snprintf(cmd, sizeof(cmd), "seek %d", static_cast<int>(offset));
    if (SendPadded(cmd) != 0) {
        TLOG("Failed to send action play.");
        return -1;
    }
    return 0;
}

int LocalPlayer::SetVolume(int v)
{
    v = ClampVolume(v);
    volume = v;
    MixerSetVolumeAll(v);
    char cmd[64];
    snprintf(cmd, sizeof(cmd), "setvol %d", v);
    if (SendPadded(cmd) != 0) {
        TLOG("Failed to send action play.");
        return -1;
    }
    return 0;
}

int LocalPlayer::Mute()
{
    if (SendPadded("mute") != 0) {
        TLOG("Failed to send action play.");
        return -1;
    }
    return 0;
}

int LocalPlayer::SetEqualizer(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    char cmd[kPaddedCommandSize];
    snprintf(cmd, sizeof(cmd), "setequ %s", text);
    if (SendPadded(cmd) != 0) {
        TLOG("Failed to send action to set equalizer.");
        return -1;
    }
    return 0;
}

// ---------------------------------------------------------------------------
// Status.

int LocalPlayer::Poll(PlayerStatusShm *segment)
{
    if (mplayerFd < 0)
        return 0;
    if (!segment) {
        TarnLog("%s:%d Shared Memory is not attached.", kLogUnit, 336);
        return -1;
    }
    volatile PlayerStatusShm *shm = segment;
    currentUri = FieldText(segment->currentUri, sizeof(segment->currentUri));
    duration = shm->duration;
    position = shm->position;
    streamTitle = FieldText(segment->streamTitle, sizeof(segment->streamTitle));
    radioStation = FieldText(segment->radioStation, sizeof(segment->radioStation));
    muted = shm->value4108 != 0;
    int32_t serial = shm->failSerial;
    if (serial != failSerialSeen) {
        failSerialSeen = serial;
        std::string why = FieldText(segment->failReason, sizeof(segment->failReason));
        if (!why.empty())
            SetError(why);
        ++failedInARow;
    }

    int32_t reported = shm->state;
    if (reported == 0)
        return 0;
    state = static_cast<uint32_t>(reported);
    if (reported == PLAYER_STATE_PLAYING && position > 0)
        failedInARow = 0;
    if (reported == PLAYER_STATE_ENDED) {
        // Written back so that the end of this song is handled once.
        shm->state = PLAYER_STATE_PLAYING;
        // Every song of the queue failed in turn (a dead station, a queue of
        // vanished files with repeat on): stop instead of trying them again
        // and again; the last error tells why.
        if (failedInARow > 0 && failedInARow >= std::max(1u, playlist->Count())) {
            TLOG("No song of the queue could be played (%u failed in a row); stopping", failedInARow);
            failedInARow = 0;
            Stop();
            state = PLAYER_STATE_STOPPED;
        } else {
            Next(true);
        }
    }

    time_t now = time(nullptr);
    if (now - lastVolumeCheck >= kVolumeCheckSeconds) {
        lastVolumeCheck = now;
        int mixer = MixerGetVolume();
        if (mixer != -1)
            volume = mixer;
    }
    return 0;
}

int LocalPlayer::PublishStatus(PublishedStatusShm *segment)
{
    if (!segment) {
        TLOG("Bad parameter");
        return -1;
    }
    if (currentUri.empty()) {
        int32_t changed = segment->changed;
        memset(segment, 0, sizeof(*segment));
        segment->shuffle = playlist->IsShuffle() ? 1 : 0;
        segment->repeatMode = playlist->GetMode();
        segment->changed = changed;
        segment->volume = volume;
        return 0;
    }

    snprintf(segment->currentUri, sizeof(segment->currentUri), "%s", currentUri.c_str());
    segment->duration = duration;
    segment->position = position;
    segment->shuffle = playlist->IsShuffle() ? 1 : 0;
    segment->repeatMode = playlist->GetMode();
    segment->state = static_cast<int32_t>(state);

    Json::Value info;
    if (PlaylistCurrentInfoJson(*playlist, info) == 0) {
        segment->index = info["current"].asInt();
        snprintf(segment->title, sizeof(segment->title), "%s", info["title"].asString().c_str());
        snprintf(segment->artist, sizeof(segment->artist), "%s",
                 info["artist"].asString().c_str());
    }
    if (!radioStation.empty()) {
        snprintf(segment->title, sizeof(segment->title), "%s", streamTitle.c_str());
        snprintf(segment->artist, sizeof(segment->artist), "%s", radioStation.c_str());
    }
    segment->volume = volume;
    return 0;
}

int LocalPlayer::GetStatusJson(Json::Value &reply)
{
    reply["PlayerState"] = static_cast<int>(state);
    reply["fdMplayer"] = mplayerFd;
    reply["CurrentUri"] = currentUri;
    reply["Duration"] = duration;
    reply["Position"] = position;
    reply["StreamTitle"] = streamTitle;
    reply["RadioStation"] = radioStation;
    reply["Volume"] = volume;
    reply["last_error"] = lastError;
    reply["error_count"] = errorCount;
    reply["Muted"] = mplayerFd >= 0 && muted;
    return 0;
}

int LocalPlayer::PollIntervalMs() const
{
    if (mplayerFd < 0)
        return -1;
    return state == PLAYER_STATE_PAUSED ? 1000 : 20;
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
    int64_t age = MonotonicMs() - startedAtMs;
    // The process writes its pid file first thing; past the first moments
    // one that is not alive ended before it connected.
    return age < kConnectWaitMs && (age < kPidFileWaitMs || IsMplayerAlive());
}

void LocalPlayer::SetError(const std::string &why)
{
    lastError = why;
    ++errorCount;
}

void LocalPlayer::SaveVolumeAndKill()
{
    if (VolumeConfSet(volume) == -1)
        TLOG("Failed to save AS_Player_Volume=%s to conf", std::to_string(volume).c_str());
    KillMplayer();
}

int LocalPlayer::GetCurrentSong(std::string &path, std::string &title)
{
    Json::Value info;
    if (PlaylistCurrentInfoJson(*playlist, info) != 0)
        return -1;
    path = info["path"].asString();
    title = info["title"].asString();
    return 0;
}
