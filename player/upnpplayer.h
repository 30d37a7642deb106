// Plays a queue on one UPnP media renderer.
#ifndef TARN_UPNPPLAYER_H
#define TARN_UPNPPLAYER_H

#include <ctime>
#include <string>

#include <json/json.h>

#include "daemon/tarn_types.h"

class Playlist;
class UpnpController;
struct RENDERER_INFO;

class UpnpPlayer {
public:
    UpnpPlayer(UpnpController *controller, int rendererIndex);
    ~UpnpPlayer();
    UpnpPlayer(const UpnpPlayer &) = delete;
    UpnpPlayer &operator=(const UpnpPlayer &) = delete;

    int ResolveHost();
    int Poll();
    int PublishStatus(PublishedStatusShm *segment);
    int HandleAction(const ControlRequest *request, Json::Value &reply);
    int SetState(int s);
    static int StateFromText(const std::string &text);
    int BuildSongUrl(const TARN_MEDIA_INFO *info, std::string &url);
    int PlayCurrent();
    int EstimateRelTime(int seconds);

    int GetRendererIndex() const { return rendererIndex; }
    void SetRendererIndex(int index) { rendererIndex = index; }
    const std::string &GetUdn() const { return udn; }
    Playlist *GetPlaylist() { return playlist; }
    int GetState() const { return state; }

private:
    int PlayPause();
    int Stop();
    int Next(bool automatic);
    int Previous(bool automatic);
    int PlayIndex(const char *text);
    int Seek(const char *text);
    int GetStatusJson(Json::Value &reply);
    RENDERER_INFO *WaitUnlocked(int milliseconds);

    int32_t state;
    Playlist *playlist;
    int32_t volume;
    bool mute;
    UpnpController *controller;
    int32_t rendererIndex;
    std::string udn;
    RENDERER_INFO *renderer;
    time_t lastSendGetInfo;
    time_t lastCheckState;
    int32_t playStarted;
    std::string host;
    // 1 after "Repeat One" sent Play at a song's end, until the renderer
    // reports anything but STOPPED.
    int32_t replayPending;
};

#endif
