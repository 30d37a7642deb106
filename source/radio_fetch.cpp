// Radio directory updaters: the station lists of the RadioIO and SHOUTcast
// sources come from a radio-browser style directory over HTTP.
#include "source/radio_fetch.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/http_fetch.h"
#include "platform/json_read.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "source/radiolist.h"

static const char kLogUnit[] = "radio_fetch";

namespace {

const long kConnectTimeoutSeconds = 5;
const long kDefaultTotalTimeoutSeconds = 20;
const long kMaxTotalTimeoutSeconds = 120;
const size_t kMaxBodyBytes = 4 * 1024 * 1024;
const int kDefaultLimit = 100;
const int kMaxLimit = 1000;

// Directory base URL without a trailing slash; "" when none is configured.
std::string DirectoryBase()
{
    char value[1024];
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "radio_directory_url", value, sizeof(value), 0) <= 0)
        return std::string();
    std::string base(value);
    while (!base.empty() && base.back() == '/')
        base.pop_back();
    return base;
}

int DirectoryLimit()
{
    char value[32];
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "radio_directory_limit", value, sizeof(value), 0) <= 0)
        return kDefaultLimit;
    long n = strtol(value, nullptr, 10);
    if (n < 1)
        return kDefaultLimit;
    return n > kMaxLimit ? kMaxLimit : static_cast<int>(n);
}

// Longest time a fetch may take (it blocks the daemon's loop meanwhile).
long DirectoryTimeout()
{
    char value[32];
    std::string conf = TarnPath(TARN_INFO_CONF);
    if (TLIBCFileGetKeyValue(conf.c_str(), "radio_directory_timeout", value, sizeof(value), 0) <= 0)
        return kDefaultTotalTimeoutSeconds;
    long n = strtol(value, nullptr, 10);
    if (n < 1)
        return kDefaultTotalTimeoutSeconds;
    return n > kMaxTotalTimeoutSeconds ? kMaxTotalTimeoutSeconds : n;
}

// Fetches url and stores the stations as the list file at path.
int UpdateListFile(const std::string &url, const std::string &path)
{
    std::string body;
    if (RadioDirectoryFetch(url, body) != 0)
        return -1;
    Json::Value list;
    if (RadioDirectoryToList(body, list) != 0) {
        TLOG("Radio directory answer from [%s] is not a station list", url.c_str());
        return -1;
    }
    if (RadioListSave(path.c_str(), list) != 0) {
        TLOG("Failed to store radio list [%s]", path.c_str());
        return -1;
    }
    return 0;
}

std::string TextMember(const Json::Value &object, const char *key)
{
    const Json::Value &v = object[key];
    return v.isString() ? v.asString() : std::string();
}

std::string Trimmed(const std::string &text)
{
    size_t b = text.find_first_not_of(" \t\r\n");
    if (b == std::string::npos)
        return std::string();
    size_t e = text.find_last_not_of(" \t\r\n");
    return text.substr(b, e - b + 1);
}

}  // namespace

int RadioDirectoryFetch(const std::string &url, std::string &body)
{
    return RadioDirectoryFetch(url, body, DirectoryTimeout());
}

int RadioDirectoryFetch(const std::string &url, std::string &body, long timeoutSeconds)
{
    if (timeoutSeconds < 1)
        timeoutSeconds = 1;
    HttpFetchOptions options;
    options.maxBytes = kMaxBodyBytes;
    options.connectTimeoutSeconds =
        timeoutSeconds < kConnectTimeoutSeconds ? timeoutSeconds : kConnectTimeoutSeconds;
    options.timeoutSeconds = timeoutSeconds;
    options.userAgent = "tarnaudiod/1.0";
    options.protocols = "http,https";
    options.maxRedirects = 3;
    options.anyEncoding = true;
    HttpFetchResult result;
    if (HttpFetch(url, options, &body, &result) != 0) {
        if (result.error == HTTP_FETCH_NO_HANDLE)
            TLOG("Failed to start an HTTP transfer for [%s]", url.c_str());
        else if (result.error == HTTP_FETCH_TOO_LARGE)
            TLOG("Radio directory answer from [%s] is larger than %zu bytes", url.c_str(),
                 kMaxBodyBytes);
        else
            TLOG("Failed to fetch [%s]: %s", url.c_str(), result.message.c_str());
        return -1;
    }
    if (result.status < 200 || result.status > 299) {
        TLOG("Failed to fetch [%s]: HTTP status %ld", url.c_str(), result.status);
        body.clear();
        return -1;
    }
    return 0;
}

int RadioDirectoryToList(const std::string &body, Json::Value &list)
{
    Json::Value answer;
    if (JsonParseBounded(body, kMaxBodyBytes, JSON_READ_MAX_DEPTH, &answer, nullptr) != 0 ||
        !answer.isArray())
        return -1;
    Json::Value stations(Json::arrayValue);
    for (Json::ArrayIndex i = 0; i < answer.size(); i++) {
        const Json::Value &entry = answer[i];
        if (!entry.isObject())
            continue;
        std::string name = Trimmed(TextMember(entry, "name"));
        std::string url = Trimmed(TextMember(entry, "url_resolved"));
        if (url.empty())
            url = Trimmed(TextMember(entry, "url"));
        if (name.empty() || url.empty())
            continue;
        Json::Value station(Json::objectValue);
        station["name"] = name;
        station["url"] = url;
        station["desc"] = Trimmed(TextMember(entry, "tags"));
        // The list files carry kilobits per second as text.
        const Json::Value &bitrate = entry["bitrate"];
        long kbps = 0;
        if (bitrate.isNumeric())
            kbps = static_cast<long>(bitrate.asDouble());
        else if (bitrate.isString())
            kbps = strtol(bitrate.asCString(), nullptr, 10);
        char text[32];
        snprintf(text, sizeof(text), "%ld", kbps > 0 ? kbps : 0L);
        station["bitrate"] = text;
        stations.append(station);
    }
    list = Json::Value(Json::objectValue);
    list["stations"] = stations;
    list["total"] = stations.size();
    return 0;
}

namespace MediaServer {

int RadioUpdateRadioio()
{
    std::string base = DirectoryBase();
    if (base.empty())
        return -1;  // no directory configured: the list stays as it is
    std::string path;
    RadioioJsonPath(path);
    char url[2048];
    snprintf(url, sizeof(url), "%s/json/stations/topclick/%d?hidebroken=true", base.c_str(),
             DirectoryLimit());
    return UpdateListFile(url, path);
}

int RadioUpdateShoutcastByGenre(const std::string &name)
{
    static const char kPrefix[] = "shoutcast_";
    if (name.compare(0, sizeof(kPrefix) - 1, kPrefix) != 0) {
        TLOG("Bad parameter. [%s]", name.c_str());
        return -1;
    }
    int index = ShoutcastGenreIndex(name.c_str() + sizeof(kPrefix) - 1);
    if (index < 0) {
        TLOG("Unknown genre in [%s]", name.c_str());
        return -1;
    }
    std::string base = DirectoryBase();
    if (base.empty())
        return -1;
    std::string path;
    if (ShoutcastJsonPath(index, path) != 0)
        return -1;
    char url[2048];
    snprintf(url, sizeof(url),
             "%s/json/stations/bytag/%s?limit=%d&hidebroken=true&order=clickcount&reverse=true",
             base.c_str(), SHOUTCAST_GENRES[index].query, DirectoryLimit());
    return UpdateListFile(url, path);
}

}  // namespace MediaServer
