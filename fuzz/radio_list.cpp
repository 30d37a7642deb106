// Fuzz target: the radio station list files and their edits.
//
// Input layout: byte 0 chooses the edit, byte 1 the list (user-defined or
// favourite); the rest up to the first 0xFF byte is the list file's
// contents, the rest after it the edit's argument (a JSON station or array of
// stations for add and edit, a comma-separated selection for delete, byte 2
// is the edit index). After every edit that reports success the file must
// read back as a list whose stations are all still present as objects or
// values, and no temporary file may be left behind.
#include <dirent.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <json/json.h>

#include "fuzz/fuzz_root.h"
#include "platform/json_read.h"
#include "source/radiolist.h"

namespace {
std::string g_root;

void WriteAll(const std::string &path, const char *data, size_t size)
{
    FILE *fp = fopen(path.c_str(), "wb");
    if (!fp)
        abort();
    if (size > 0 && fwrite(data, 1, size, fp) != size)
        abort();
    fclose(fp);
}

int CountEntries(const std::string &dir)
{
    DIR *d = opendir(dir.c_str());
    if (!d)
        return -1;
    int n = 0;
    while (struct dirent *e = readdir(d)) {
        if (e->d_name[0] != '.')
            n++;
    }
    closedir(d);
    return n;
}
}  // namespace

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    g_root = FuzzMakeRoot();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size < 3 || size > 64 * 1024)
        return 0;
    int op = data[0] % 4;
    int type = (data[1] & 1) ? RADIO_LIST_FAVORITE : RADIO_LIST_USERDEF;
    unsigned index = data[2];
    const char *body = reinterpret_cast<const char *>(data + 3);
    size_t bodyLen = size - 3;
    const char *sep = static_cast<const char *>(memchr(body, 0xFF, bodyLen));
    size_t fileLen = sep ? static_cast<size_t>(sep - body) : bodyLen;
    std::string arg = sep ? std::string(sep + 1, body + bodyLen) : std::string();

    std::string path;
    if (RadioListPath(type, path) != 0)
        abort();
    std::string dir = path.substr(0, path.rfind('/'));
    WriteAll(path, body, fileLen);
    int before = CountEntries(dir);

    // The station count of the file as it was (-1: not a list).
    long oldCount = -1;
    {
        Json::Value old;
        if (JsonParseBounded(std::string(body, fileLen), 1 << 20, JSON_READ_MAX_DEPTH, &old, nullptr) == 0 &&
            old.isObject() &&
            old["stations"].isArray())
            oldCount = static_cast<long>(old["stations"].size());
    }
    Json::Value list;
    int rc = 0;
    Json::Value argJson;
    switch (op) {
    case 0:
        rc = RadioListGet(type, list);
        if (rc == 0)
            NormalizeBitrates(list);
        return 0;
    case 1:
        JsonParseBounded(arg, 1 << 20, JSON_READ_MAX_DEPTH, &argJson, nullptr);
        rc = RadioListAdd(type, argJson);
        break;
    case 2:
        JsonParseBounded(arg, 1 << 20, JSON_READ_MAX_DEPTH, &argJson, nullptr);
        rc = RadioListEdit(type, index, argJson);
        break;
    default:
        rc = RadioListDelete(type, arg);
        break;
    }
    if (CountEntries(dir) != before) {
        fprintf(stderr, "radio_list: edit %d left %d files in the radio folder (was %d)\n", op,
                CountEntries(dir), before);
        abort();
    }
    if (rc != 0)
        return 0;
    // What was saved reads back as a list object with an array of stations,
    // and the count of stations moved as the edit says.
    Json::Value back;
    std::string text;
    {
        FILE *fp = fopen(path.c_str(), "rb");
        if (!fp)
            abort();
        char chunk[4096];
        size_t n;
        while ((n = fread(chunk, 1, sizeof(chunk), fp)) > 0)
            text.append(chunk, n);
        fclose(fp);
    }
    if (text == std::string(body, fileLen))
        return 0;  // nothing to change, nothing written
    if (JsonParseBounded(text, 1 << 24, JSON_READ_MAX_DEPTH + 2, &back, nullptr) != 0 || !back.isObject() || !back["stations"].isArray()) {
        fprintf(stderr, "radio_list: edit %d saved no list: %s\n", op, text.c_str());
        abort();
    }
    long now = static_cast<long>(back["stations"].size());
    bool ok = true;
    if (op == 1 && oldCount >= 0)
        ok = now == oldCount + (argJson.isArray() ? static_cast<long>(argJson.size()) : 0);
    else if (op == 2 && oldCount >= 0)
        ok = now == (static_cast<long>(index) >= oldCount ? oldCount + 1 : oldCount);
    else if (op == 3 && oldCount >= 0)
        ok = now <= oldCount;
    if (op != 2 && (!back["total"].isIntegral() || back["total"].asLargestInt() != now))
        ok = false;
    if (!ok) {
        fprintf(stderr, "radio_list: edit %d: %ld stations before, %ld after, total %s\n", op,
                oldCount, now, back["total"].toStyledString().c_str());
        abort();
    }
    return 0;
}
