// The remote's player routes: transport, queue, players and equalizer.
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

void WebRemote::RegisterTransportApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Transport -----------------------------------------------------------
    static const std::pair<const char *, int> simple[] = {
        {"play-pause", ACT_PLAY_PAUSE}, {"stop", ACT_STOP},          {"next", ACT_NEXT},
        {"previous", ACT_PREVIOUS},     {"mute", ACT_MUTE},          {"volume-up", ACT_VOLUME_UP},
        {"volume-down", ACT_VOLUME_DOWN}, {"shuffle", ACT_TOGGLE_SHUFFLE},
    };
    for (auto &s : simple) {
        int action = s.second;
        server.Post(std::string("/api/player/") + s.first, [this, action](Req, Res res) {
            Json::Value r;
            if (Send(res, action, "", &r)) {
                hub->Kick();
                Ok(res);
            }
        });
    }
    server.Post("/api/player/volume", [this](Req req, Res res) {
        Json::Value body;
        int v = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "volume", 0, 100, &v))
            return Error(res, 400, "volume: a number from 0 to 100");
        if (Send(res, ACT_SET_VOLUME, std::to_string(v))) {
            hub->Kick();
            Ok(res);
        }
    });
    server.Post("/api/player/seek", [this](Req req, Res res) {
        Json::Value body;
        int v = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "position", 0, 24 * 3600 * 7, &v))
            return Error(res, 400, "position: seconds from the start of the song");
        if (Send(res, ACT_SEEK, std::to_string(v))) {
            hub->Kick();
            Ok(res);
        }
    });
    server.Post("/api/player/repeat", [this](Req req, Res res) {
        Json::Value body;
        int mode = 0;
        if (!Body(req, res, &body))
            return;
        if (!body.isMember("mode")) {
            // Without a mode: the next one after the current (works on
            // renderers too, which only take a mode).
            Json::Value s;
            Json::CharReaderBuilder rb;
            std::unique_ptr<Json::CharReader> r(rb.newCharReader());
            std::string text = hub->Current();
            r->parse(text.data(), text.data() + text.size(), &s, nullptr);
            mode = s.get("repeat", REPEAT_MODE_OFF).asInt() % REPEAT_MODE_ALL + 1;
        } else if (!IntField(body, "mode", REPEAT_MODE_OFF, REPEAT_MODE_ALL, &mode)) {
            return Error(res, 400, "mode: 1 normal, 2 repeat one, 3 repeat all");
        }
        if (Send(res, ACT_SET_REPEAT_MODE, std::to_string(mode))) {
            hub->Kick();
            Json::Value v(Json::objectValue);
            v["repeat"] = mode;
            Ok(res, v);
        }
    });
}

void WebRemote::RegisterQueueApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Queue -----------------------------------------------------------------
    server.Get("/api/queue", [](Req req, Res res) {
        int start = std::max(0, Param(req, "start", 0));
        int limit = std::min(64, std::max(1, Param(req, "limit", 50)));
        Json::Value r;
        std::string error;
        if (QueuePage(start, limit, &r, &error) != 0)
            return Error(res, 503, error);
        if (!r.isObject())
            return Error(res, 409, "no player is selected");
        Json::Value v(Json::objectValue);
        v["start"] = start;
        v["total"] = r.get("total", 0).asInt();
        v["current"] = r.get("current", 0).asInt();
        v["items"] = Json::Value(Json::arrayValue);
        for (const Json::Value &u : r["uris"])
            v["items"].append(QueueItem(u));
        Reply(res, v);
    });
    static const std::pair<const char *, int> byIndex[] = {
        {"play", ACT_PLAY_INDEX}, {"remove", ACT_QUEUE_REMOVE}};
    for (auto &q : byIndex) {
        int action = q.second;
        server.Post(std::string("/api/queue/") + q.first, [this, action](Req req, Res res) {
            Json::Value body;
            int index = 0;
            if (!Body(req, res, &body))
                return;
            if (!IntField(body, "index", 0, INT32_MAX, &index))
                return Error(res, 400, "index: a queue position from 0");
            if (Send(res, action, std::to_string(index))) {
                hub->Kick();
                Ok(res);
            }
        });
    }
    server.Post("/api/queue/clear", [this](Req, Res res) {
        if (Send(res, ACT_QUEUE_CLEAR, "")) {
            hub->Kick();
            Ok(res);
        }
    });
    // Moves an entry: removed, then inserted at its new place. "to": the
    // place it takes in the new order; "next": right after the current song.
    server.Post("/api/queue/move", [this](Req req, Res res) {
        Json::Value body, page;
        int from = 0, to = 0;
        std::string error;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "from", 0, INT32_MAX, &from))
            return Error(res, 400, "from: the queue position to move");
        if (QueuePage(from, 1, &page, &error) != 0)
            return Error(res, 503, error);
        int total = page.get("total", 0).asInt(), current = page.get("current", 0).asInt();
        if (!page["uris"].isArray() || page["uris"].empty() || from >= total)
            return Error(res, 404, "no queue entry " + std::to_string(from));
        if (body.get("next", false).asBool())
            to = current < from ? current + 1 : current;
        else if (!IntField(body, "to", 0, total - 1, &to))
            return Error(res, 400, "to: a queue position from 0 to " + std::to_string(total - 1));
        if (to == from)
            return Ok(res);
        TARN_MEDIA_INFO info = RecordFromItem(page["uris"][0]);
        if (!Send(res, ACT_QUEUE_REMOVE, std::to_string(from)))
            return;
        bool ok = to >= total - 1 ? SendRecord(res, ACT_QUEUE_ADD, info, 0)
                                  : SendRecord(res, ACT_QUEUE_INSERT, info, to);
        hub->Kick();
        if (ok)
            Ok(res);
    });
}

void WebRemote::RegisterPlayersApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Players -----------------------------------------------------------------
    server.Get("/api/players", [this](Req, Res res) {
        Json::Value r, status;
        std::string error;
        if (WebDaemonAction(ACT_LIST_RENDERERS, "0 0", &r, &error) != 0)
            return Error(res, 503, error);
        Json::Value v(Json::objectValue);
        v["renderers"] = Json::Value(Json::arrayValue);
        for (const Json::Value &e : r["list"]) {
            Json::Value p(Json::objectValue);
            p["index"] = e.get("index", 0).asInt();
            p["name"] = e.get("friendly_name", "").asString();
            p["address"] = e.get("ip", "").asString();
            v["renderers"].append(p);
        }
        Json::CharReaderBuilder rb;
        std::unique_ptr<Json::CharReader> reader(rb.newCharReader());
        std::string text = hub->Current();
        reader->parse(text.data(), text.data() + text.size(), &status, nullptr);
        v["selected"] = status["player"];
        Reply(res, v);
    });
    server.Post("/api/players/select", [this](Req req, Res res) {
        Json::Value body;
        int index = 0;
        if (!Body(req, res, &body))
            return;
        if (!IntField(body, "index", -1, 4096, &index))
            return Error(res, 400, "index: -1 for this device, else a renderer's index");
        if (!Send(res, ACT_SELECT_PLAYER, std::to_string(index)))
            return;
        std::string text = hub->Current();
        Json::Value status;
        Json::CharReaderBuilder rb;
        std::unique_ptr<Json::CharReader> reader(rb.newCharReader());
        reader->parse(text.data(), text.data() + text.size(), &status, nullptr);
        if (status["player"].get("index", -2).asInt() != index)
            return Error(res, 404, "that renderer is no longer on the network");
        Ok(res);
    });
    server.Post("/api/players/refresh", [](Req, Res res) {
        if (Send(res, ACT_SEARCH_RENDERERS, ""))
            Ok(res);
    });
}

void WebRemote::RegisterEqualizerApi(httplib::Server &server)
{
    using Req = const httplib::Request &;
    using Res = httplib::Response &;

    // -- Equalizer -----------------------------------------------------------------
    server.Get("/api/equalizer", [this](Req, Res res) {
        std::vector<EqProfile> profiles;
        ReadProfiles(TarnPath(kEqSystem), false, &profiles);
        ReadProfiles(TarnPath(kEqUser), true, &profiles);
        Json::Value v(Json::objectValue);
        v["profiles"] = Json::Value(Json::arrayValue);
        for (auto &p : profiles) {
            Json::Value e(Json::objectValue);
            e["name"] = p.name;
            e["gains"] = GainsJson(p.gains);
            e["user"] = p.user;
            v["profiles"].append(e);
        }
        v["enabled"] = ConfValue(options.confPath, "audio_enable_equalizer") == "yes";
        v["current"] = ConfValue(options.confPath, "audio_default_equalizer");
        Reply(res, v);
    });
    // {"name": profile} applies a profile and keeps it as the default;
    // {"gains": [10 numbers]} applies gains; {"enabled": false} goes flat.
    server.Post("/api/equalizer", [this](Req req, Res res) {
        Json::Value body;
        if (!Body(req, res, &body))
            return;
        float gains[10] = {0};
        std::string name;
        bool off = body.isMember("enabled") && !body["enabled"].asBool();
        if (body.isMember("name") && !off) {
            name = body["name"].asString();
            char text[1024];
            int found = EqProfileLookup(TarnPath(kEqSystem).c_str(), name.c_str(), text, sizeof(text));
            if (found == 0)
                found = EqProfileLookup(TarnPath(kEqUser).c_str(), name.c_str(), text, sizeof(text));
            if (found != 1 || name.empty())
                return Error(res, 404, "no equalizer profile " + name);
            Json::Value g = GainsJson(text);
            for (Json::ArrayIndex i = 0; i < g.size() && i < 10; ++i)
                gains[i] = g[i].asFloat();
        } else if (body["gains"].isArray() && !off) {
            if (body["gains"].size() != 10)
                return Error(res, 400, "gains: ten numbers from -12 to 12");
            for (int i = 0; i < 10; ++i) {
                const Json::Value &g = body["gains"][i];
                if (!g.isNumeric() || g.asDouble() < -12 || g.asDouble() > 12)
                    return Error(res, 400, "gains: ten numbers from -12 to 12");
                gains[i] = g.asFloat();
            }
        } else if (!off) {
            return Error(res, 400, "give a profile name, ten gains or enabled:false");
        }
        char text[256];
        CtrlFormatEqualizer(gains, text, sizeof(text));
        Json::Value status;
        std::string s = hub->Current();
        Json::CharReaderBuilder rb;
        std::unique_ptr<Json::CharReader> reader(rb.newCharReader());
        reader->parse(s.data(), s.data() + s.size(), &status, nullptr);
        if (status["player"].get("kind", "").asString() == "renderer")
            return Error(res, 409, "the equalizer works on this device's own output; select it first");
        if (!Send(res, ACT_SET_EQUALIZER, text))
            return;
        if (!name.empty() || off) {
            if (!name.empty() &&
                TLIBCFileSetKeyValue(options.confPath.c_str(), "audio_default_equalizer", name.c_str(),
                                     "%s=\"%s\"\n") != 0)
                return Error(res, 500, "the profile was applied but could not be kept in " + options.confPath);
            TLIBCFileSetKeyValue(options.confPath.c_str(), "audio_enable_equalizer", off ? "no" : "yes",
                                 "%s=\"%s\"\n");
        }
        Ok(res);
    });
}
