#include "source/asxparse.h"

#include <cstdio>
#include <cstring>
#include <strings.h>

#include "platform/tarn_env.h"
#include "platform/tarn_log.h"
#include "platform/tlibc_conf.h"

static const char kLogUnit[] = "asxparse";

namespace {

// fgets into line and trim it; false at the end of the file (or on an error,
// which the caller tells apart with ferror).
bool ReadTrimmedLine(FILE *fp, char *line, int size)
{
    if (!fgets(line, size, fp))
        return false;
    TLIBCStrTrimSpace(line, 0);
    return true;
}

}  // namespace

int AsxParse(const char *path, Json::Value &list)
{
    if (!path || !path[0]) {
        TLOG("Bad parameters.");
        return -1;
    }
    FILE *fp = fopen(path, "r");
    if (!fp)
        return -1;

    Json::Value stations(Json::arrayValue);
    char line[4096];
    // The title and URL belong to the whole file, not to one entry: an entry
    // that lacks one of the tags keeps the value of an earlier entry.
    char title[255] = "";
    char url[4096] = "";

    for (;;) {
        // Outside an entry: look for a line opening one.
        if (!ReadTrimmedLine(fp, line, sizeof(line)))
            break;
        if (!line[0] || strncasecmp(line, "<Entry>", 7) != 0)
            continue;

        // Inside an entry, until "</Entry>" or the end of the file.
        while (ReadTrimmedLine(fp, line, sizeof(line))) {
            if (!line[0])
                continue;
            if (strncasecmp(line, "<Entry>", 7) == 0)
                continue;
            if (strncasecmp(line, "</Entry>", 8) == 0)
                break;
            if (strncasecmp(line, "<TITLE>", 7) == 0) {
                memset(title, 0, sizeof(title));
                const char *start = line + 7;
                const char *end = strstr(start, "</TITLE>");
                if (!end)
                    continue;
                size_t n = static_cast<size_t>(end - start);
                if (n > sizeof(title) - 1)
                    n = sizeof(title) - 1;
                memcpy(title, start, n);
                title[n] = '\0';
            } else if (strncasecmp(line, "<Ref href", 9) == 0) {
                memset(url, 0, sizeof(url));
                const char *open = strchr(line, '"');
                if (!open)
                    continue;
                const char *close = strchr(open + 1, '"');
                if (!close)
                    continue;
                size_t n = static_cast<size_t>(close - open - 1);
                if (n > sizeof(url) - 1)
                    n = sizeof(url) - 1;
                memcpy(url, open + 1, n);
                url[n] = '\0';
            }
        }

        if (title[0] && url[0]) {
            Json::Value station(Json::objectValue);
            station["name"] = title;
            station["url"] = url;
            station["desc"] = "";
            stations.append(station);
        }
    }

    if (ferror(fp)) {
        fclose(fp);
        return -1;
    }
    list["total"] = stations.size();
    list["stations"] = stations;
    fclose(fp);
    return 0;
}

int AsxImportDefault(int type, Json::Value &list)
{
    const char *file = nullptr;
    if (type == 1)
        file = TARN_ASX_MANUAL;
    else if (type == 2)
        file = TARN_ASX_DEFAULT;
    else
        return -1;
    std::string path = TarnPath(file);
    return AsxParse(path.c_str(), list);
}
