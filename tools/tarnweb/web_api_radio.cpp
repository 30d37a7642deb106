// The remote's radio routes: station lists, playing a station and editing the lists.
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

void WebRemote::RegisterRadioApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Radio -------------------------------------------------------------------
    server.Get("/api/radio", [](Req req, Res res) {
        int type = ListType(req.get_param_value("list"));
        if (!type)
            return Error(res, 400, "list: favorite or userdef");
        Json::Value list;
        if (RadioListGet(type, list) != 0)
            return Error(res, 503, "the station list cannot be read");
        Json::Value v(Json::objectValue);
        v["stations"] = Json::Value(Json::arrayValue);
        for (const Json::Value &s : list["stations"]) {
            Json::Value e(Json::objectValue);
            e["name"] = s.get("name", "").asString();
            e["url"] = s.get("url", "").asString();
            e["desc"] = s.get("desc", "").asString();
            e["bitrate"] = s["bitrate"].isNumeric() ? s["bitrate"].asInt() : 0;
            v["stations"].append(e);
        }
        v["total"] = list.get("total", 0).asInt();
        Reply(res, v);
    });
    server.Post("/api/radio/play", [this](Req req, Res res) {
        Json::Value body, list;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        if (!type || !IntField(body, "index", 0, INT32_MAX, &index))
            return Error(res, 400, "list (favorite or userdef) and index of a station");
        if (RadioListGet(type, list) != 0 || index >= static_cast<int>(list["stations"].size()))
            return Error(res, 404, "no such station");
        const Json::Value &station = list["stations"][index];
        if (type == RADIO_LIST_FAVORITE && list.get("total", 0).asInt() != 0) {
            // The radio source plays the favourites: the whole list is
            // queued, so next and previous step through the stations.
            if (!Send(res, ACT_SOURCE_RADIO, "", nullptr, 20000))
                return;
            if (index > 0 && !Send(res, ACT_PLAY_INDEX, std::to_string(index)))
                return;
        } else {
            TARN_MEDIA_INFO info;
            memset(&info, 0, sizeof(info));
            snprintf(info.title, sizeof(info.title), "%s", station.get("name", "").asString().c_str());
            snprintf(info.path, sizeof(info.path), "%s", station.get("url", "").asString().c_str());
            if (!Send(res, ACT_QUEUE_CLEAR, "") || !SendRecord(res, ACT_QUEUE_ADD, info, 0) ||
                !Send(res, ACT_PLAY_INDEX, "0"))
                return;
        }
        hub->Kick();
        Ok(res);
    });
}

void WebRemote::RegisterRadioEditApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    server.Post("/api/radio/add", [](Req req, Res res) {
        std::lock_guard<std::mutex> lock(radioMutex);
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        std::string name = body.get("name", "").asString(), url = body.get("url", "").asString();
        if (!type || name.empty() || name.size() > 254 || !ValidStreamUrl(url))
            return Error(res, 400, "a station needs a name and an http(s) stream URL");
        Json::Value stations(Json::arrayValue), s(Json::objectValue);
        s["name"] = name;
        s["url"] = url;
        s["desc"] = body.get("desc", "").asString();
        stations.append(s);
        bool saved = false;
        if (RadioListAdd(type, stations, &saved) != 0 || !saved)
            return Error(res, 500, "the station list could not be saved");
        Ok(res);
    });
    server.Post("/api/radio/rename", [](Req req, Res res) {
        std::lock_guard<std::mutex> lock(radioMutex);
        Json::Value body, list;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        std::string name = body.get("name", "").asString();
        if (!type || !IntField(body, "index", 0, INT32_MAX, &index) || name.empty() || name.size() > 254)
            return Error(res, 400, "list, index and a new name");
        if (RadioListGet(type, list) != 0 || index >= static_cast<int>(list["stations"].size()))
            return Error(res, 404, "no such station");
        Json::Value s = list["stations"][index];
        s["name"] = name;
        if (!s.isMember("desc"))
            s["desc"] = "";
        if (body.isMember("url")) {
            if (!ValidStreamUrl(body["url"].asString()))
                return Error(res, 400, "url: an http(s) stream URL");
            s["url"] = body["url"].asString();
        }
        bool saved = false;
        if (RadioListEdit(type, static_cast<unsigned>(index), s, &saved) != 0 || !saved)
            return Error(res, 500, "the station list could not be saved");
        Ok(res);
    });
    server.Post("/api/radio/remove", [](Req req, Res res) {
        std::lock_guard<std::mutex> lock(radioMutex);
        Json::Value body, list;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        int type = ListType(body.get("list", "").asString());
        if (!type || !IntField(body, "index", 0, INT32_MAX, &index))
            return Error(res, 400, "list and index of a station");
        if (RadioListGet(type, list) != 0 || index >= static_cast<int>(list["stations"].size()))
            return Error(res, 404, "no such station");
        bool saved = false;
        if (RadioListDelete(type, std::to_string(index), &saved) != 0 || !saved)
            return Error(res, 500, "the station list could not be saved");
        Ok(res);
    });
}
