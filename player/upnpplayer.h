// Plays a queue on one UPnP media renderer.
#ifndef TARN_UPNPPLAYER_H
#define TARN_UPNPPLAYER_H

#include <ctime>
#include <string>
#include <vector>

#include <json/json.h>

#include "platform/tarn_media_info.h"
#include "wire/tarn_wire.h"

class Playlist;
class UpnpController;
struct RENDERER_INFO;
struct RendererAction;

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
    // The renderer left the network: the player stays (with its queue) but
    // does nothing until OnRendererBack. selected: it was the selected one.
    void OnRendererGone(bool selected);
    void OnRendererBack(int index);
    bool IsGone() const { return goneSince != 0; }
    time_t GoneSince() const { return goneSince; }
    bool WasSelected() const { return wasSelected; }
    Playlist *GetPlaylist() { return playlist; }
    int GetState() const { return state; }

private:
    // The table of the actions HandleAction dispatches (upnpplayer.cpp).
    friend struct UpnpPlayerActions;

    int PlayPause();
    int Stop();
    int Next(bool automatic);
    int Previous(bool automatic);
    int PlayIndex(const char *text);
    int Seek(const char *text);
    void ChangeVolume(int code, const char *text);
    int GetStatusJson(Json::Value &reply);
    int StartJob(int kind, const std::vector<RendererAction> &steps, const std::string &url);
    void FinishJob(RENDERER_INFO *r);
    int HandNext(RENDERER_INFO *r);
    void FollowNext();
    bool MovedOnToNext(RENDERER_INFO *r);
    void ExpectNextAfter(int position);
    int SongUrlAndMetadata(const TARN_MEDIA_INFO *song, std::string &url, std::string &metadata);

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

    // The job this player waits for (UpnpController::StartJob) and what it
    // does; 0 / JOB_NONE when none.
    long jobId;
    int jobKind;
    time_t jobStarted;
    std::string jobUrl;      // the song URL the job hands over
    std::string playingUrl;  // the URL of the song the renderer plays
    std::string nextUrl;     // the URL handed as the next song
    bool nextDirty;          // the queue changed after nextUrl was handed
    bool nextRefused;        // the renderer refused a next song for this one
    // Some renderers name the song handed ahead as soon as they have it,
    // while the one before still plays: the renderer has moved on to it once
    // its position went back from the furthest seen since it was handed
    // (nextTopRel, seconds), or once the song before is over by the clock
    // (nextDueMs, monotonic). The position is asked every little while
    // meanwhile (positionAskedMs).
    int32_t nextTopRel;
    long long nextDueMs;
    long long positionAskedMs;
    // The renderer's count of PLAYING reports when this song was started:
    // a later one means it really played, so a STOPPED is the song's end.
    uint32_t playingReportsAtStart;
    time_t goneSince;  // when the renderer left; 0 while it is there
    bool wasSelected;
    std::string lastError;
    // Play refused with 701 (the renderer still between two states): sent
    // again a little later, a few times, before it counts as a failure.
    int playRetries;
    long long retryPlayAtMs;  // 0: none due
    int retryKind;
};

#endif
