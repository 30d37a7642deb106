// The remote's library and source routes.
#include <httplib.h>

#include <algorithm>
#include <cstring>
#include <fstream>

#include "audio/info.h"
#include "daemon/ctrl.h"
#include "platform/media_playlists.h"
#include "platform/medialib.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "source/radiolist.h"
#include "tools/tarnweb/web_remote.h"
#include "tools/tarnweb/web_api_util.h"

using namespace webapi;

void WebRemote::RegisterLibraryApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Library ---------------------------------------------------------------
    server.Get("/api/library/artists", [this](Req, Res res) {
        Json::Value v(Json::objectValue), list;
        std::string error;
        if (library->Artists(&list, &error) != 0)
            return Error(res, 503, error);
        v["artists"] = list;
        Reply(res, v);
    });
    server.Get("/api/library/albums", [this](Req req, Res res) {
        Json::Value v(Json::objectValue), list;
        std::string error;
        if (library->Albums(req.get_param_value("artist"), req.has_param("artist"), &list, &error) != 0)
            return Error(res, 503, error);
        v["albums"] = list;
        Reply(res, v);
    });
    server.Get("/api/library/songs", [this](Req req, Res res) {
        Json::Value v(Json::objectValue);
        std::string error;
        if (library->Songs(req.get_param_value("artist"), req.has_param("artist"), req.get_param_value("album"),
                           req.has_param("album"), Param(req, "start", 0), Param(req, "limit", 200), &v,
                           &error) != 0)
            return Error(res, 503, error);
        Reply(res, v);
    });
    server.Get("/api/library/search", [this](Req req, Res res) {
        Json::Value v(Json::objectValue);
        std::string error, q = req.get_param_value("q");
        if (q.empty())
            return Error(res, 400, "q: the text to look for");
        if (library->Search(q, req.get_param_value("field"), Param(req, "limit", 200), &v, &error) != 0)
            return Error(res, 503, error);
        Reply(res, v);
    });
}

void WebRemote::RegisterLibraryChangeApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    server.Post("/api/library/add", [this](Req req, Res res) { AddLibrarySongs(req, res); });
    server.Get("/api/library/scan", [this](Req, Res res) { Reply(res, library->ScanState()); });
    server.Post("/api/library/rescan", [this](Req, Res res) { RescanLibrary(res); });
}

// The song ids a library add names: {"ids":[...]} or every song of
// {"artist":..,"album":..}. 0, or -1 with the library's error.
int WebRemote::LibraryAddIds(const Json::Value &body, std::vector<uint32_t> *ids, std::string *error)
{
    if (body["ids"].isArray()) {
        for (const Json::Value &id : body["ids"])
            if (id.isNumeric() && id.asLargestInt() > 0 && id.asLargestInt() <= UINT32_MAX)
                ids->push_back(static_cast<uint32_t>(id.asLargestUInt()));
    } else if (body.isMember("artist") || body.isMember("album")) {
        Json::Value list;
        if (library->Songs(body.get("artist", "").asString(), body.isMember("artist"),
                           body.get("album", "").asString(), body.isMember("album"), 0,
                           static_cast<int>(kMostSongsPerAdd), &list, error) != 0)
            return -1;
        for (const Json::Value &s : list["songs"])
            ids->push_back(s["id"].asUInt());
    }
    return 0;
}

// Adds songs: {"ids":[...]} or every song of {"artist":..,"album":..};
// "where": "end" (default), "next" (after the current song) or "play"
// (after the current song, and play the first of them now).
void WebRemote::AddLibrarySongs(const httplib::Request &req, httplib::Response &res)
{
    Json::Value body;
    std::string error;
    if (!Body(req, res, &body))
        return;
    std::vector<uint32_t> ids;
    if (LibraryAddIds(body, &ids, &error) != 0)
        return Error(res, 503, error);
    if (ids.empty() || ids.size() > kMostSongsPerAdd)
        return Error(res, 400, "ids: 1 to " + std::to_string(kMostSongsPerAdd) + " song ids of the library");
    std::vector<MediaSong> songs;
    if (library->SongsById(ids, &songs, &error) != 0)
        return Error(res, 503, error);
    if (songs.empty())
        return Error(res, 404, "none of these songs is in the library");
    std::string where = body.get("where", "end").asString();
    Json::Value page;
    if (QueuePage(0, 1, &page, &error) != 0)
        return Error(res, 503, error);
    int total = page.get("total", 0).asInt(), current = page.get("current", 0).asInt();
    int at = where == "end" || total == 0 ? total : current + 1;
    for (size_t i = 0; i < songs.size(); ++i) {
        TARN_MEDIA_INFO info;
        MediaSongToInfo(songs[i], &info);
        SetCover(&info);
        int pos = at + static_cast<int>(i);
        bool ok = pos >= total + static_cast<int>(i) ? SendRecord(res, ACT_QUEUE_ADD, info, 0)
                                                     : SendRecord(res, ACT_QUEUE_INSERT, info, pos);
        if (!ok) {
            hub->Kick();
            return;
        }
    }
    if (where == "play" && !Send(res, ACT_PLAY_INDEX, std::to_string(at)))
        return;
    hub->Kick();
    Json::Value v(Json::objectValue);
    v["added"] = static_cast<int>(songs.size());
    v["at"] = at;
    Ok(res, v);
}

// Scans the folders of music_dir (separated by ':'), else the library's own.
void WebRemote::RescanLibrary(httplib::Response &res)
{
    std::vector<std::string> folders;
    std::string dirs = ConfValue(options.confPath, "music_dir");
    for (size_t at = 0; at <= dirs.size();) {
        size_t end = dirs.find(':', at);
        if (end == std::string::npos)
            end = dirs.size();
        if (end > at)
            folders.push_back(dirs.substr(at, end - at));
        at = end + 1;
    }
    if (folders.empty() && !library->SongFolder().empty())
        folders.push_back(library->SongFolder());
    if (folders.empty())
        return Error(res, 409, "no music folder known: set music_dir in " + options.confPath);
    StatusHub *h = hub.get();
    if (library->StartScan(folders, [h](const Json::Value &state) { h->Publish("scan", Compact(state)); }) != 0)
        return Error(res, 409, "a scan is running already");
    Json::Value v(Json::objectValue);
    v["folder"] = folders[0];
    for (const std::string &f : folders)
        v["folders"].append(f);
    Ok(res, v);
}

void WebRemote::RegisterSourceApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Sources -----------------------------------------------------------------
    server.Get("/api/sources", [](Req, Res res) {
        Json::Value v(Json::objectValue);
        v["slots"] = Json::Value(Json::arrayValue);
        for (int slot = 1; slot <= kCustomSlots; ++slot) {
            std::string type, second, third;
            Json::Value s(Json::objectValue);
            s["slot"] = slot;
            if (TARNAudioCustomGet(slot, type, second, third) == 0) {
                s["type"] = type;
                s["name"] = type == "smart" ? second : (third.empty() ? second : third);
            } else {
                s["type"] = "";
                s["name"] = "";
            }
            v["slots"].append(s);
        }
        std::vector<TARN_PLAYLIST_INFO> lists;
        v["playlists"] = Json::Value(Json::arrayValue);
        if (TARNPlaylistListAll(lists, 0, 0, 0) == 0)
            for (auto &p : lists) {
                Json::Value e(Json::objectValue);
                e["path"] = p.path;
                e["title"] = p.title;
                v["playlists"].append(e);
            }
        int total = 0;
        v["smart"] = Json::Value(Json::arrayValue);
        for (const std::string &name : MediaServer::SmartPLSEnum(0, 0, total, nullptr))
            v["smart"].append(name);
        Reply(res, v);
    });
    server.Post("/api/source", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        static const std::pair<const char *, int> kinds[] = {
            {"random", ACT_SOURCE_RANDOM},     {"radio", ACT_SOURCE_RADIO}, {"ipod", ACT_SOURCE_IPOD},
            {"playlist", ACT_SOURCE_PLAYLIST}, {"next", ACT_SOURCE_NEXT},   {"previous", ACT_SOURCE_PREVIOUS},
            {"custom", ACT_SOURCE_CUSTOM}};
        std::string kind = body.get("kind", "").asString();
        int action = 0, slot = 0;
        for (auto &k : kinds)
            if (kind == k.first)
                action = k.second;
        if (!action)
            return Error(res, 400, "kind: random, radio, ipod, playlist, next, previous or custom");
        if (action == ACT_SOURCE_CUSTOM && !IntField(body, "slot", 1, kCustomSlots, &slot))
            return Error(res, 400, "slot: 1 to " + std::to_string(kCustomSlots));
        // Fetching a radio list may take the daemon a while.
        if (Send(res, action, action == ACT_SOURCE_CUSTOM ? std::to_string(slot) : "", nullptr, 20000)) {
            hub->Kick();
            Ok(res);
        }
    });
    server.Post("/api/source/save", [](Req req, Res res) {
        Json::Value body;
        int slot = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "slot", 1, kCustomSlots, &slot))
            return Error(res, 400, "slot: 1 to " + std::to_string(kCustomSlots));
        if (Send(res, ACT_SAVE_CUSTOM, std::to_string(slot)))
            Ok(res);
    });
}

void WebRemote::RegisterSourceListApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // Plays one saved ({"path":...}) or smart ({"smart":name}) playlist.
    server.Post("/api/source/list", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        std::vector<TARN_MEDIA_INFO> songs;
        if (body.isMember("path")) {
            int count = 0;
            std::string path = body["path"].asString();
            std::vector<TARN_PLAYLIST_INFO> lists;
            TARNPlaylistListAll(lists, 0, 0, 0);
            if (std::none_of(lists.begin(), lists.end(), [&](const TARN_PLAYLIST_INFO &p) { return p.path == path; }))
                return Error(res, 404, "no saved playlist " + path);
            if (ParsePlayListByFieldGivenPath(path.c_str(), &count, 0, 0, "*", 1, songs) != 0)
                return Error(res, 409, "the playlist has no playable song");
        } else {
            int total = 0;
            std::vector<std::string> names = MediaServer::SmartPLSEnum(0, 0, total, nullptr);
            auto it = std::find(names.begin(), names.end(), body.get("smart", "").asString());
            if (it == names.end())
                return Error(res, 404, "no smart playlist of that name");
            std::list<TARN_MEDIA_INFO> list;
            MediaServer::SmartPLSListSongs(static_cast<int>(it - names.begin()), 0, 0, total, list);
            songs.assign(list.begin(), list.end());
            if (songs.empty())
                return Error(res, 409, "no song matches the smart playlist");
        }
        if (songs.size() > kMostSongsPerAdd)
            songs.resize(kMostSongsPerAdd);
        if (!Send(res, ACT_QUEUE_CLEAR, ""))
            return;
        for (TARN_MEDIA_INFO &info : songs) {
            SetCover(&info);
            if (!SendRecord(res, ACT_QUEUE_ADD, info, 0)) {
                hub->Kick();
                return;
            }
        }
        if (Send(res, ACT_PLAY_INDEX, "0")) {
            hub->Kick();
            Ok(res);
        }
    });
}
