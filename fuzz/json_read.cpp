// Fuzz target: the bounded JSON reader and the radio directory answer built
// on it. Whatever the input (nesting, truncation, huge numbers, bad UTF-8),
// the reader must return 0 with a value or -1 with a null value and a
// reason, never throw or exhaust the stack; a directory answer it accepts
// must turn into a list of objects only.
#include <cstdint>
#include <cstdlib>
#include <string>

#include <json/json.h>

#include "platform/json_read.h"
#include "source/radio_fetch.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    std::string text(reinterpret_cast<const char *>(data), size);
    Json::Value v;
    std::string why;
    int rc = JsonParseBounded(text, 1 << 20, JSON_READ_MAX_DEPTH, &v, &why);
    if (rc != 0 && (!v.isNull() || why.empty()))
        abort();
    if (rc != 0 && rc != -1)
        abort();
    Json::Value list;
    if (RadioDirectoryToList(text, list) == 0) {
        const Json::Value &stations = list["stations"];
        if (!stations.isArray())
            abort();
        for (const Json::Value &s : stations)
            if (!s.isObject() || !s["url"].isString())
                abort();
    }
    return 0;
}
