#include "player/upnpplayer.h"

#include <strings.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <algorithm>
#include <climits>
#include <cstring>

#include "platform/media_id.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tarn_media_types.h"
#include "platform/tarn_net.h"
#include "platform/tlibc_conf.h"
#include "player/playlist.h"
#include "upnp/upnp.h"
#include "upnp/xml_util.h"

static const char kLogUnit[] = "upnpplayer";

namespace {

const int kUrlSize = 4096;
const int kWaitStepMs = 200;
const int kStopWaitSteps = 6;

const char *StateText(int s)
{
    switch (s) {
    case PLAYER_STATE_STOPPED:
        return "STOPPED";
    case PLAYER_STATE_PLAYING:
        return "PLAYING";
    case PLAYER_STATE_PAUSED:
        return "PAUSED_PLAYBACK";
    case PLAYER_STATE_TRANSITIONING:
        return "TRANSITIONING";
    default:
        return nullptr;
    }
}

}  // namespace

UpnpPlayer::UpnpPlayer(UpnpController *controller, int rendererIndex)
    : state(PLAYER_STATE_NONE),
      playlist(new Playlist()),
      volume(-1),
      mute(false),
      controller(controller),
      rendererIndex(rendererIndex),
      renderer(nullptr),
      lastSendGetInfo(time(nullptr)),
      lastCheckState(lastSendGetInfo),
      playStarted(0),
      replayPending(0)
{
    if (!controller || rendererIndex < 0 ||
        controller->GetRenderer(static_cast<unsigned>(rendererIndex), &renderer) != 0 || !renderer) {
        TLOG("fatal error, cannot get renderer info.");
        renderer = nullptr;
    } else {
        udn = renderer->udn;
    }
    ResolveHost();
}

UpnpPlayer::~UpnpPlayer()
{
    delete playlist;
}

int UpnpPlayer::ResolveHost()
{
    TARN_NET_CARD card;
    if (TARNNetGetCard1(&card) <= 0) {
        TLOG("get network error.");
        return -1;
    }
    host = card.ip;
    char port[8] = "";
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "admin_port", port, sizeof(port), 0) > 0) {
        host += ":";
        host += port;
        return 0;
    }
    return -1;
}

int UpnpPlayer::StateFromText(const std::string &text)
{
    for (int s = PLAYER_STATE_STOPPED; s <= PLAYER_STATE_TRANSITIONING; ++s) {
        if (text == StateText(s))
            return s;
    }
    return PLAYER_STATE_NONE;
}

int UpnpPlayer::SetState(int s)
{
    state = s;
    const char *text = StateText(s);
    if (text) {
        if (renderer)
            renderer->transport_state = text;
    } else {
        TLOG("SetState not handled, PlayerState [%d]", s);
    }
    lastSendGetInfo = lastCheckState = time(nullptr);
    return 0;
}

int UpnpPlayer::BuildSongUrl(const TARN_MEDIA_INFO *info, std::string &url)
{
    if (!info)
        return -1;
    char path[sizeof(info->path) + 1];
    snprintf(path, sizeof(path), "%.*s", static_cast<int>(sizeof(info->path)), info->path);
    if (strncasecmp(path, "http", 4) == 0) {
        url = path;
        return 0;
    }
    char ext[32];
    const char *known = TARNIndexExtGet(path);
    snprintf(ext, sizeof(ext), "%s", known ? known : "txt");

    char buffer[kUrlSize];
    int n;
    // Songs of the library go by their id; songs on a USB volume and songs
    // queued by path (no id) by a path token that only this installation
    // can make.
    if (TARNAudioIsUSBVolume(path) != 1 && info->id != 0) {
        char token[MEDIA_ID_TOKEN_LEN + 1];
        if (MediaIDEncryption(info->id, token, sizeof(token)) != 0) {
            TLOG("Failed to make the song id text of song [%u]", info->id);
            return -1;
        }
        n = snprintf(buffer, sizeof(buffer), "http://%s/audio/webUI/audiotransfer.cgi/%s.%s",
                     host.c_str(), token, ext);
    } else {
        std::string token = MediaPathToken(path);
        if (token.empty()) {
            TLOG("Failed to make the path token of [%s]", path);
            return -1;
        }
        n = snprintf(buffer, sizeof(buffer), "http://%s/audio/webUI/audiotransfer.cgi/ipod/%s.%s",
                     host.c_str(), token.c_str(), ext);
    }
    if (n < 0 || n >= static_cast<int>(sizeof(buffer))) {
        TLOG("Song URL too long for [%s]", path);
        return -1;
    }
    url = buffer;
    return 0;
}

// Lets the libupnp threads deliver answers while this thread waits, then
// finds the renderer again: it may have left or moved meanwhile.
RENDERER_INFO *UpnpPlayer::WaitUnlocked(int milliseconds)
{
    controller->Unlock();
    usleep(milliseconds * 1000);
    controller->Lock();
    renderer = nullptr;
    int index = controller->FindRendererByUdn(udn);
    if (index < 0)
        return nullptr;
    controller->SelectRenderer(static_cast<unsigned>(index));
    RENDERER_INFO *r = nullptr;
    if (controller->GetRenderer(static_cast<unsigned>(index), &r) != 0)
        return nullptr;
    renderer = r;
    return r;
}

int UpnpPlayer::PlayCurrent()
{
    TARN_MEDIA_INFO *song = new TARN_MEDIA_INFO;
    int result = -1;
    RENDERER_INFO *r = nullptr;
    std::string url, metadata;
    if (playlist->GetCurrentSong(song) != 0) {
        TLOG("Failed to get current song in playlist.");
        goto out;
    }
    if (controller->GetCurrentRenderer(&r) != 0 || !r) {
        TLOG("Failed to GetCurrentRenderer()");
        goto out;
    }
    renderer = r;
    if (r->transport_state != "STOPPED") {
        if (controller->Stop() != 0) {
            TLOG("Failed to send upnp stop");
            goto out;
        }
        playStarted = 0;
        // Wait for the renderer to report that it stopped; each step asks it
        // again and leaves the lock to the threads that bring the answer.
        for (int i = 0; i < kStopWaitSteps; ++i) {
            if (r->transport_state == "STOPPED" || r->transport_state == "NO_MEDIA_PRESENT")
                break;
            controller->GetTransportInfo();
            r = WaitUnlocked(kWaitStepMs);
            if (!r) {
                TLOG("Renderer [%s] left while stopping", udn.c_str());
                goto out;
            }
        }
    }
    if (BuildSongUrl(song, url) != 0) {
        TLOG("Failed to convert uri for audiotransfer.cgi");
        goto out;
    }
    if (BuildDidlMetadata(song, url.c_str(), metadata) != 0) {
        TLOG("Failed to combine metadata.");
        goto out;
    }
    if (controller->SetAVTransportURI(url.c_str(), metadata.c_str()) != 0) {
        TLOG("Failed to set current uri [%s]", url.c_str());
        goto out;
    }
    if (!WaitUnlocked(kWaitStepMs)) {
        TLOG("Renderer [%s] left before play", udn.c_str());
        goto out;
    }
    if (controller->Play() != 0) {
        TLOG("Failed to send upnp play");
        goto out;
    }
    SetState(PLAYER_STATE_PLAYING);
    playStarted = 1;
    result = 0;
out:
    delete song;
    return result;
}

int UpnpPlayer::PlayPause()
{
    if (state == PLAYER_STATE_PLAYING) {
        if (controller->Pause() != 0) {
            TLOG("Failed to send upnp pause");
            return -1;
        }
        SetState(PLAYER_STATE_PAUSED);
    } else if (state == PLAYER_STATE_PAUSED) {
        if (controller->Play() != 0) {
            TLOG("Failed to send upnp play");
            return -1;
        }
        SetState(PLAYER_STATE_PLAYING);
    } else if (PlayCurrent() != 0) {
        return -1;
    }
    playStarted = 1;
    return 0;
}

int UpnpPlayer::Stop()
{
    int r = controller->Stop();
    SetState(PLAYER_STATE_STOPPED);
    playStarted = 0;
    return r;
}

int UpnpPlayer::Next(bool automatic)
{
    if (automatic && playlist->GetMode() == 2) {
        if (!replayPending) {
            // The renderer still holds the song: play it again.
            if (controller->Play() != 0)
                TLOG("Failed to send upnp play");
            else
                replayPending = 1;
            return -1;
        }
        // Still stopped one check after that Play: this renderer forgot the
        // song at its end (some clear their URI), so it is given again.
        replayPending = 0;
        PlayCurrent();
        return -1;
    }
    std::string uri;
    if (playlist->Next(uri, false) != 0)
        Stop();
    else
        PlayCurrent();
    return -1;
}

int UpnpPlayer::Previous(bool automatic)
{
    std::string uri;
    if (playlist->Previous(uri, automatic) != 0)
        Stop();
    else
        PlayCurrent();
    return -1;
}

int UpnpPlayer::PlayIndex(const char *text)
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
    return PlayCurrent();
}

int UpnpPlayer::Seek(const char *text)
{
    if (!text) {
        TLOG("Bad parameter");
        return -1;
    }
    if (controller->Seek(static_cast<int>(strtol(text, nullptr, 10))) != 0) {
        TLOG("Failed to seek [%s]", text);
        return -1;
    }
    return 0;
}

int UpnpPlayer::EstimateRelTime(int seconds)
{
    if (seconds < 1)
        return 0;
    if (state != PLAYER_STATE_PLAYING)
        return seconds;
    return seconds + static_cast<int>(time(nullptr) - lastSendGetInfo);
}

int UpnpPlayer::GetStatusJson(Json::Value &reply)
{
    if (controller->GetRendererState(reply) != 0) {
        reply["error"] = "Failed to get UPnP Renderer Info";
        return -1;
    }
    reply["playerMute"] = mute;
    reply["playerVolume"] = volume;
    reply["last_send_get_info"] = static_cast<Json::Int64>(lastSendGetInfo);
    reply["last_check_state"] = static_cast<Json::Int64>(lastCheckState);
    reply["RelTime"] = EstimateRelTime(reply.get("RelTime", 0).asInt());
    return 0;
}

int UpnpPlayer::HandleAction(const ControlRequest *request, Json::Value &reply)
{
    if (!request) {
        TLOG("Bad parameter");
        return -1;
    }
    if (!controller) {
        TLOG("No UPnP Control");
        return -1;
    }
    int code = request->action;
    const char *text = request->parameter;
    int result = 0;
    controller->Lock();
    if (code >= ACT_PLAY_PAUSE && code <= ACT_SEEK)
        replayPending = 0;
    // The record may have been replaced since the last turn.
    RENDERER_INFO *r = nullptr;
    int index = controller->FindRendererByUdn(udn);
    if (index >= 0 && controller->GetRenderer(static_cast<unsigned>(index), &r) == 0)
        renderer = r;
    else
        renderer = nullptr;
    switch (code) {
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
        Previous(false);
        break;
    case ACT_PLAY_INDEX:
        PlayIndex(text);
        break;
    case ACT_SEEK:
        Seek(text);
        break;
    case ACT_MUTE:
        controller->SetMute(!mute);
        break;
    case ACT_SET_VOLUME: {
        long v = strtol(text, nullptr, 10);
        if (v < 0)
            v = 0;
        if (v > 100)
            v = 100;
        controller->SetVolume(static_cast<int>(v));
        break;
    }
    case ACT_VOLUME_UP:
    case ACT_VOLUME_DOWN: {
        // Not clamped to 0..100, but a renderer reporting an absurd volume
        // must not make the step overflow.
        long long v = static_cast<long long>(volume) + (code == ACT_VOLUME_UP ? 3 : -3);
        controller->SetVolume(static_cast<int>(std::max<long long>(INT_MIN, std::min<long long>(INT_MAX, v))));
        break;
    }
    case ACT_GET_STATUS:
        result = GetStatusJson(reply);
        break;
    case ACT_QUEUE_ADD:
    case ACT_QUEUE_REMOVE:
    case ACT_QUEUE_CLEAR:
    case ACT_QUEUE_INSERT:
    case ACT_QUEUE_SET_CURRENT:
    case ACT_SET_REPEAT_MODE:
    case ACT_TOGGLE_SHUFFLE:
    case ACT_QUEUE_LIST:
        playlist->HandleAction(request, reply);
        break;
    default:
        TarnLog("%s:%d Action [%d] not handled", kLogUnit, 739, code);
        result = -1;
        break;
    }
    controller->Unlock();
    return result;
}

int UpnpPlayer::Poll()
{
    if (!renderer || !controller)
        return -1;
    int index = controller->FindRendererByUdn(udn);
    if (index < 0 || index != rendererIndex)
        return -1;
    RENDERER_INFO *r = nullptr;
    if (controller->GetRenderer(static_cast<unsigned>(index), &r) != 0 || !r)
        return -1;
    renderer = r;

    int s = StateFromText(r->transport_state);
    if (s == PLAYER_STATE_NONE)
        return 0;
    state = s;
    if (s != PLAYER_STATE_STOPPED)
        replayPending = 0;
    mute = strtol(r->mute.c_str(), nullptr, 10) != 0;
    volume = static_cast<int32_t>(strtol(r->volume.c_str(), nullptr, 10));

    time_t now = time(nullptr);
    if (now - lastSendGetInfo > 0) {
        lastSendGetInfo = now;
        controller->GetPositionInfo();
        controller->GetTransportInfo();
    }
    if (now - lastCheckState >= 6) {
        lastCheckState = now;
        if (playStarted == 1 && state == PLAYER_STATE_STOPPED)
            Next(true);
    }
    return 0;
}

int UpnpPlayer::PublishStatus(PublishedStatusShm *segment)
{
    if (!segment) {
        TLOG("Bad parameter");
        return -1;
    }
    if (!controller)
        return -1;
    controller->Lock();
    RENDERER_INFO *r = nullptr;
    int index = controller->FindRendererByUdn(udn);
    if (index < 0 || controller->GetRenderer(static_cast<unsigned>(index), &r) != 0 || !r) {
        controller->Unlock();
        return -1;
    }
    renderer = r;
    int32_t rendererVolume = static_cast<int32_t>(strtol(r->volume.c_str(), nullptr, 10));
    if (state != PLAYER_STATE_PLAYING && state != PLAYER_STATE_PAUSED) {
        int32_t changed = segment->changed;
        memset(segment, 0, sizeof(*segment));
        segment->changed = changed;
        segment->volume = rendererVolume;
        segment->shuffle = playlist->IsShuffle() ? 1 : 0;
        segment->repeatMode = playlist->GetMode();
        controller->Unlock();
        return 0;
    }
    snprintf(segment->currentUri, sizeof(segment->currentUri), "%s", r->current_uri.c_str());
    segment->duration = r->duration;
    segment->position = r->rel_time;
    segment->volume = rendererVolume;
    segment->shuffle = playlist->IsShuffle() ? 1 : 0;
    segment->repeatMode = playlist->GetMode();
    segment->state = state;
    Json::Value info;
    if (playlist->GetCurrentInfoJson(info) == 0) {
        if (info.isMember("current"))
            segment->index = info["current"].asInt();
        if (info.isMember("title"))
            snprintf(segment->title, sizeof(segment->title), "%s", info["title"].asCString());
        if (info.isMember("artist"))
            snprintf(segment->artist, sizeof(segment->artist), "%s", info["artist"].asCString());
    }
    controller->Unlock();
    return 0;
}
