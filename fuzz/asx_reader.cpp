// Fuzz target: the ASX station file reader. The input is the file's
// contents; the result must have the list shape the radio lists use (an
// array of stations with a name and a url each, and a total that matches).
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include <json/json.h>

#include "fuzz/fuzz_root.h"
#include "source/asxparse.h"

namespace {
std::string g_path;
}

extern "C" int LLVMFuzzerInitialize(int *, char ***)
{
    g_path = FuzzMakeRoot() + "/usr/tarn/etc/audio/fuzz.asx";
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    FILE *fp = fopen(g_path.c_str(), "wb");
    if (!fp)
        abort();
    if (size > 0 && fwrite(data, 1, size, fp) != size)
        abort();
    fclose(fp);

    Json::Value list;
    if (AsxParse(g_path.c_str(), list) != 0)
        return 0;
    const Json::Value &stations = list["stations"];
    if (!stations.isArray() || !list["total"].isIntegral() ||
        list["total"].asLargestInt() != static_cast<Json::LargestInt>(stations.size())) {
        fprintf(stderr, "asx_reader: list shape broken: %s\n", list.toStyledString().c_str());
        abort();
    }
    for (Json::ArrayIndex i = 0; i < stations.size(); i++) {
        if (!stations[i]["name"].isString() || !stations[i]["url"].isString()) {
            fprintf(stderr, "asx_reader: station %u without name or url\n", i);
            abort();
        }
    }
    // Written back as a list file would be: must serialise.
    Json::StyledWriter writer;
    std::string text = writer.write(list);
    (void)text;
    return 0;
}
