// Shared by the files of the remote's JSON API (web_api.cpp,
// web_api_player.cpp, web_api_library.cpp, web_api_radio.cpp): replies,
// request bodies, the daemon requests and the record and list helpers.
#ifndef TARNWEB_WEB_API_UTIL_H
#define TARNWEB_WEB_API_UTIL_H

#include <httplib.h>

#include <cstddef>
#include <mutex>
#include <string>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"

namespace webapi {

const char kCoverFormat[] = "modules/Aurelon/webUI/getcover.cgi/ebdart/%lu.jpg";
const char kPlaceholderArt[] = "modules/Aurelon/images/thumb/thumb_file.png";
const char kEqSystem[] = "/usr/tarn/etc.defaults/audio/equalizer.system";
const char kEqUser[] = "/usr/tarn/etc/audio/equalizer.user";
const int kCustomSlots = 6;      // slots offered by the page: 1..6
const size_t kMostSongsPerAdd = 2000;
// The station list files are read, changed and written whole: one change at a time.
extern std::mutex radioMutex;

std::string Compact(const Json::Value &v);
void Reply(httplib::Response &res, const Json::Value &v, int status = 200);
void Error(httplib::Response &res, int status, const std::string &why);
void Ok(httplib::Response &res, const Json::Value &extra = Json::Value());
// The request's JSON body ({} when empty); false (and a 400) when unreadable.
bool Body(const httplib::Request &req, httplib::Response &res, Json::Value *out);
bool IntField(const Json::Value &body, const char *name, int low, int high, int *out);
int Param(const httplib::Request &req, const char *name, int fallback);
// Sends one action; false after answering with the reason. A reply that
// carries "error" (a full queue) counts as refused.
bool Send(httplib::Response &res, int action, const std::string &text, Json::Value *reply = nullptr,
          int timeoutMs = 3000);
bool SendRecord(httplib::Response &res, int action, const TARN_MEDIA_INFO &info, int position);
void SetCover(TARN_MEDIA_INFO *info);
// A queue entry as the page shows it.
Json::Value QueueItem(const Json::Value &u);
// Rebuilds the record of a queue entry from its list item (for a move).
TARN_MEDIA_INFO RecordFromItem(const Json::Value &u);
// One page of the queue; the daemon's reply is at most 8191 characters, so
// a page that does not fit is asked for again in halves.
int QueuePage(int start, int limit, Json::Value *out, std::string *error);

struct EqProfile {
    std::string name, gains;
    bool user;
};
void ReadProfiles(const std::string &path, bool user, std::vector<EqProfile> *out);
Json::Value GainsJson(const std::string &text);
std::string ConfValue(const std::string &conf, const char *key);
int ListType(const std::string &name);
bool ValidStreamUrl(const std::string &url);

}  // namespace webapi

#endif
