#include "source/radiolist.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <fstream>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/json_read.h"
#include "source/radio_fetch.h"
#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"
#include "source/asxparse.h"

static const char kLogUnit[] = "radiolist";

const ShoutcastGenre SHOUTCAST_GENRES[SHOUTCAST_GENRE_COUNT] = {
    {"Alternative", "Alternative"},
    {"Blues", "Blues"},
    {"Classical", "Classical"},
    {"Country", "Country"},
    {"Decades", "Decades"},
    {"Easy Listening", "Easy"},
    {"Electronic", "Electronic"},
    {"Folk", "Folk"},
    {"Hip Hop", "Hip%20Hop"},
    {"Rap", "Rap"},
    {"Inspirational", "Inspirational"},
    {"International", "International"},
    {"JPop", "JPop"},
    {"Jazz", "Jazz"},
    {"Latin", "Latin"},
    {"Metal", "Metal"},
    {"New Age", "New%20Age"},
    {"Pop", "Pop"},
    {"R&B", "RnB"},
    {"Urban", "Urban"},
    {"Reggae", "Reggae"},
    {"Rock", "Rock"},
    {"Holiday", "Holiday"},
    {"Soundtracks", "Soundtracks"},
    {"Talk", "Talk"},
    {"Themes", "Themes"},
};

int RadioListPath(int type, std::string &path)
{
    switch (type) {
    case RADIO_LIST_USERDEF:
        path = TarnPath(TARN_RADIO_USERDEF);
        return 0;
    case RADIO_LIST_FAVORITE:
        path = TarnPath(TARN_RADIO_FAVORITE);
        return 0;
    default:
        return -1;
    }
}

int RadioioJsonPath(std::string &path)
{
    path = TarnPath(TARN_RADIO_RADIOIO);
    return 0;
}

int ShoutcastJsonPath(int index, std::string &path)
{
    if (static_cast<unsigned>(index) > SHOUTCAST_GENRE_COUNT - 1) {
        TLOG("Bad parameter. Index [%d] out of range [0:%d]", index, SHOUTCAST_GENRE_COUNT);
        return -1;
    }
    path = TarnPath(TARN_RADIO_DIR) + "/shoutcast_" + SHOUTCAST_GENRES[index].display + ".json";
    return 0;
}

int ShoutcastGenreIndex(const char *genre)
{
    if (!genre) {
        TLOG("Bad parameter.");
        return -1;
    }
    for (int i = 0; i < SHOUTCAST_GENRE_COUNT; i++) {
        if (strcmp(SHOUTCAST_GENRES[i].display, genre) == 0)
            return i;
    }
    return -1;
}

int ShoutcastGenreList(Json::Value &array)
{
    for (int i = 0; i < SHOUTCAST_GENRE_COUNT; i++)
        array[i] = SHOUTCAST_GENRES[i].display;
    return 0;
}

int RadioListIsStale(const char *path)
{
    if (!path) {
        TLOG("Bad parameter.");
        return 1;
    }
    struct stat st;
    if (stat(path, &st) != 0) {
        if (errno != ENOENT)
            TLOG("Failed to stat [%s], [%m]", path);
        return 1;
    }
    time_t now = time(nullptr);
    if (now == static_cast<time_t>(-1)) {
        TLOG("Failed to get current time. %m");
        return 1;
    }
    // A signed 32-bit age: a modification time in the future counts as fresh.
    int32_t age = static_cast<int32_t>(now - st.st_mtime);
    return age > 86399 ? 1 : 0;
}

void NormalizeBitrates(Json::Value &list)
{
    if (!list.isObject() && !list.isNull())
        return;
    Json::Value &stations = list["stations"];
    if (!stations.isArray())
        return;
    for (Json::ArrayIndex i = 0; i < stations.size(); i++) {
        if (!stations[i].isObject() && !stations[i].isNull())
            continue;
        Json::Value &bitrate = stations[i]["bitrate"];
        if (bitrate.isString()) {
            long kbps = strtol(bitrate.asCString(), nullptr, 10);
            bitrate = static_cast<Json::Int64>(kbps) * 1000;
        }
    }
}

size_t RadioListMaxBytes()
{
    return TarnConfNumber("radio_list_max_bytes", RADIO_LIST_DEFAULT_MAX_BYTES);
}

unsigned RadioListMaxStations()
{
    return static_cast<unsigned>(TarnConfNumber("radio_list_max_stations", RADIO_LIST_DEFAULT_MAX_STATIONS));
}

namespace {

// A member of a station object; null for anything that is not an object.
Json::Value Member(const Json::Value &value, const char *key)
{
    return value.isObject() ? value[key] : Json::Value();
}

// Makes list an object whose "stations" is an array, so that the edits
// below never meet a file of another shape. false when it had to be reset.
bool MakeListShape(Json::Value &list)
{
    bool ok = true;
    if (!list.isObject()) {
        ok = list.isNull();
        list = Json::Value(Json::objectValue);
    }
    if (!list["stations"].isArray()) {
        ok = ok && list["stations"].isNull();
        list["stations"] = Json::Value(Json::arrayValue);
    }
    return ok;
}

// Parses the file at path into list. A file that cannot be opened reads as
// an empty text, which is no valid JSON.
int ReadListFile(const std::string &path, Json::Value &list)
{
    std::string why;
    if (JsonReadFileBounded(path, RadioListMaxBytes(), JSON_READ_MAX_DEPTH, &list, &why) != 0) {
        TLOG("Failed to parse json file [%s]: %s", path.c_str(), why.c_str());
        return -1;
    }
    const Json::Value &stations = list.isObject() ? list["stations"] : Json::Value::nullSingleton();
    unsigned max = RadioListMaxStations();
    if (stations.isArray() && stations.size() > max) {
        TLOG("Radio list [%s] holds %u stations, more than radio_list_max_stations (%u)", path.c_str(),
             static_cast<unsigned>(stations.size()), max);
        list = Json::Value();
        return -1;
    }
    NormalizeBitrates(list);
    return 0;
}

// Creates the temporary file beside path; -1 with errno set on failure.
int OpenTemporary(const std::string &tmp)
{
    int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    if (fd < 0 && errno == EEXIST) {
        // Left behind by an earlier process of the same pid.
        unlink(tmp.c_str());
        fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    }
    return fd;
}

}  // namespace

int RadioListGet(int type, Json::Value &list)
{
    std::string path;
    if (RadioListPath(type, path) != 0) {
        TLOG("Could not find the path of type: %d", type);
        return -1;
    }
    if (access(path.c_str(), F_OK) != 0) {
        // No list written yet: the stations shipped with the appliance.
        if (AsxImportDefault(type, list) != 0) {
            list["stations"] = Json::Value(Json::arrayValue);
            list["total"] = 0;
        }
        return 0;
    }
    return ReadListFile(path, list);
}

int RadioioListGet(Json::Value &list, bool force)
{
    std::string path;
    if (RadioioJsonPath(path) != 0) {
        TLOG("Failed to get RadioIO json path.");
        return -1;
    }
    if (force || RadioListIsStale(path.c_str()) == 1)
        MediaServer::RadioUpdateRadioio();
    return ReadListFile(path, list);
}

int ShoutcastListGet(int index, Json::Value &list, bool force)
{
    std::string path;
    if (ShoutcastJsonPath(index, path) != 0) {
        TLOG("Failed to get SHOUTcast json path by index [%d]", index);
        return -1;
    }
    if (force || RadioListIsStale(path.c_str()) == 1)
        MediaServer::RadioUpdateShoutcastByGenre(std::string("shoutcast_") +
                                                 SHOUTCAST_GENRES[index].display);
    return ReadListFile(path, list);
}

int ShoutcastListGetByGenre(const char *genre, Json::Value &list, bool force)
{
    int index = ShoutcastGenreIndex(genre);
    if (index == -1) {
        TLOG("Failed to get SHOUTcast index by genre [%s]", genre ? genre : "(null)");
        return -1;
    }
    return ShoutcastListGet(index, list, force);
}

// The styled writer writes a member name only up to its first NUL byte: a
// name such as "stations\0..." read from a damaged file would come out as a
// second "stations" member and, read back, shadow the real one (the edit
// just saved would be lost). Such members are left out of what is written.
static Json::Value WithoutNulNames(const Json::Value &value)
{
    if (value.isObject()) {
        Json::Value out(Json::objectValue);
        for (Json::ValueConstIterator it = value.begin(); it != value.end(); ++it) {
            std::string name = it.name();
            if (name.find('\0') != std::string::npos)
                continue;
            out[name] = WithoutNulNames(*it);
        }
        return out;
    }
    if (value.isArray()) {
        Json::Value out(Json::arrayValue);
        for (Json::ArrayIndex i = 0; i < value.size(); i++)
            out.append(WithoutNulNames(value[i]));
        return out;
    }
    return value;
}

int RadioListSave(const char *path, const Json::Value &list)
{
    if (!path) {
        TLOG("Bad parameter.");
        return -1;
    }
    Json::StyledWriter writer;
    std::string text = writer.write(WithoutNulNames(list));

    // The text goes to a temporary file beside the list, which replaces the
    // list only once it is complete: a full disk leaves the old list intact.
    char suffix[32];
    snprintf(suffix, sizeof(suffix), ".tmp.%d", static_cast<int>(getpid()));
    std::string tmp = std::string(path) + suffix;

    int fd = OpenTemporary(tmp);
    if (fd < 0) {
        if (errno != ENOENT) {
            TLOG("Failed to fopen [%s], [%m]", path);
            return -1;
        }
        // Only the radio directory is ever created, whatever the path.
        std::string dir = TarnPath(TARN_RADIO_DIR);
        if (mkdir(dir.c_str(), 0644) != 0) {
            TLOG("Failed to mkdir [%s], [%m]", dir.c_str());
            return -1;
        }
        fd = OpenTemporary(tmp);
        if (fd < 0) {
            TLOG("Failed to fopen [%s] after mkdir, [%m]", path);
            return -1;
        }
    }
    FILE *fp = fdopen(fd, "wb");
    if (!fp) {
        TLOG("Failed to fopen [%s], [%m]", path);
        close(fd);
        unlink(tmp.c_str());
        return -1;
    }
    size_t written = fwrite(text.data(), 1, text.size(), fp);
    // A full disk may show only when the buffered text is flushed.
    bool ok = written == text.size() && fflush(fp) == 0 && fsync(fileno(fp)) == 0;
    if (!ok) {
        TLOG("Failed to fwrite [%s], [%m]", tmp.c_str());
        fclose(fp);
        unlink(tmp.c_str());
        return -1;
    }
    if (fclose(fp) != 0) {
        TLOG("Failed to fwrite [%s], [%m]", tmp.c_str());
        unlink(tmp.c_str());
        return -1;
    }
    if (rename(tmp.c_str(), path) != 0) {
        TLOG("Failed to rename [%s] to [%s], [%m]", tmp.c_str(), path);
        unlink(tmp.c_str());
        return -1;
    }
    return 0;
}

int RadioListAdd(int type, const Json::Value &stations, bool *saved)
{
    if (saved)
        *saved = false;
    std::string path;
    if (RadioListPath(type, path) != 0) {
        TLOG("Could not find the path of type: %d", type);
        return -1;
    }
    Json::Value list;
    if (RadioListGet(type, list) != 0 || !MakeListShape(list)) {
        TLOG("Could not get the list of type: %d", type);
        return -1;
    }
    Json::Value &all = list["stations"];
    if (stations.isArray()) {
        for (Json::ArrayIndex i = 0; i < stations.size(); i++)
            all.append(stations[i]);
    }
    list["total"] = all.size();
    if (RadioListSave(path.c_str(), list) != 0)
        TLOG("Could not save list of type: %d to [%s]", type, path.c_str());
    else if (saved)
        *saved = true;
    return 0;
}

int RadioListEdit(int type, unsigned index, const Json::Value &station, bool *saved)
{
    if (saved)
        *saved = false;
    std::string path;
    if (RadioListPath(type, path) != 0) {
        TLOG("Could not find the path of type: %d", type);
        return -1;
    }
    Json::Value list;
    if (RadioListGet(type, list) != 0)
        TLOG("Could not get the list of type: %d", type);
    MakeListShape(list);

    Json::Value &stations = list["stations"];
    // An index equal to the size appends a station; "total" stays as it was.
    if (index > stations.size()) {
        TLOG("Bad index: %d", static_cast<int>(index));
        return -1;
    }
    Json::Value &target = stations[index];
    if (!target.isObject())
        target = Json::Value(Json::objectValue);
    target["desc"] = Member(station, "desc");
    target["name"] = Member(station, "name");
    target["url"] = Member(station, "url");
    if (RadioListSave(path.c_str(), list) != 0)
        TLOG("Could not save list of type: %d to [%s]", type, path.c_str());
    else if (saved)
        *saved = true;
    return 0;
}

int RadioListDelete(int type, const std::string &selection, bool *saved)
{
    if (saved)
        *saved = false;
    std::string path;
    if (RadioListPath(type, path) != 0) {
        TLOG("Could not find the path of type: %d", type);
        return -1;
    }
    Json::Value list;
    if (RadioListGet(type, list) != 0)
        TLOG("Could not get the list of type: %d", type);
    MakeListShape(list);

    Json::Value &stations = list["stations"];
    if (stations.size() == 0) {
        TLOG("No stations to delete.");
        if (saved)
            *saved = true;
        return 0;
    }
    TLIBC_SZLIST *items = TLIBCSzListAlloc(1024);
    if (!items) {
        TLOG("Failed to malloc list.");
        return -1;
    }
    TLIBCStrSep(selection.c_str(), ",", &items);
    TLIBCSzListSortItems(items, 1);
    int count = TLIBCSzListCount(items);
    if (count == 0) {
        TLOG("There is no selected item.");
        TLIBCSzListFree(items);
        if (saved)
            *saved = true;
        return 0;
    }

    Json::ArrayIndex size = stations.size();
    for (int k = 0; k < count; k++) {
        const char *item = TLIBCSzListGet(items, k);
        if (!item)
            continue;
        long i = strtol(item, nullptr, 10);
        // Marks at or past the end are never looked at again; they are not
        // made (a huge index would only grow the tree).
        if (i < 0 || i >= static_cast<long>(size))
            continue;
        if (!stations[static_cast<Json::ArrayIndex>(i)].isObject())
            stations[static_cast<Json::ArrayIndex>(i)] = Json::Value(Json::objectValue);
        stations[static_cast<Json::ArrayIndex>(i)]["destroy"] = true;
    }

    Json::Value kept(Json::objectValue);
    kept["stations"] = Json::Value(Json::arrayValue);
    for (Json::ArrayIndex i = 0; i < size; i++) {
        // The non-const subscript leaves a null "destroy" on kept stations.
        if (!stations[i].isObject()) {
            kept["stations"].append(stations[i]);
            continue;
        }
        if (!(stations[i]["destroy"] == true))
            kept["stations"].append(stations[i]);
    }
    kept["total"] = kept["stations"].size();
    if (RadioListSave(path.c_str(), kept) != 0)
        TLOG("Could not save list of type: %d to [%s]", type, path.c_str());
    else if (saved)
        *saved = true;
    TLIBCSzListFree(items);
    return 0;
}
