// Radio directory updaters: the station lists of the RadioIO and SHOUTcast
// sources come from a radio-browser style directory over HTTP.
#include "source/radio_fetch.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <curl/curl.h>

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

struct Body {
    std::string *text;
    bool tooLarge;
};

size_t WriteBody(char *data, size_t size, size_t count, void *user)
{
    Body *body = static_cast<Body *>(user);
    size_t n = size * count;
    if (body->text->size() + n > kMaxBodyBytes) {
        body->tooLarge = true;
        return 0;  // aborts the transfer
    }
    body->text->append(data, n);
    return n;
}

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
    body.clear();
    CURL *curl = curl_easy_init();
    if (!curl) {
        TLOG("Failed to start an HTTP transfer for [%s]", url.c_str());
        return -1;
    }
    Body sink = {&body, false};
    char error[CURL_ERROR_SIZE] = "";
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    if (timeoutSeconds < 1)
        timeoutSeconds = 1;
    curl_easy_setopt(curl, CURLOPT_CONNECTTIMEOUT,
                     timeoutSeconds < kConnectTimeoutSeconds ? timeoutSeconds : kConnectTimeoutSeconds);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT, timeoutSeconds);
    curl_easy_setopt(curl, CURLOPT_FOLLOWLOCATION, 1L);
    curl_easy_setopt(curl, CURLOPT_MAXREDIRS, 3L);
    curl_easy_setopt(curl, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(curl, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(curl, CURLOPT_MAXFILESIZE, static_cast<long>(kMaxBodyBytes));
    curl_easy_setopt(curl, CURLOPT_USERAGENT, "tarnaudiod/1.0");
    curl_easy_setopt(curl, CURLOPT_ACCEPT_ENCODING, "");
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, WriteBody);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &sink);
    curl_easy_setopt(curl, CURLOPT_ERRORBUFFER, error);

    CURLcode rc = curl_easy_perform(curl);
    long status = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    curl_easy_cleanup(curl);

    if (sink.tooLarge || rc == CURLE_FILESIZE_EXCEEDED) {
        TLOG("Radio directory answer from [%s] is larger than %zu bytes", url.c_str(),
             kMaxBodyBytes);
        body.clear();
        return -1;
    }
    if (rc != CURLE_OK) {
        TLOG("Failed to fetch [%s]: %s", url.c_str(), error[0] ? error : curl_easy_strerror(rc));
        body.clear();
        return -1;
    }
    if (status < 200 || status > 299) {
        TLOG("Failed to fetch [%s]: HTTP status %ld", url.c_str(), status);
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
