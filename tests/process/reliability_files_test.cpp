// "/etc/tarninfo.conf", the radio lists and the custom-slot settings on small
// tmpfs mounts (in a mount namespace of its own) that are full to several
// levels or read-only: the daemon keeps serving and exits 0, every file keeps
// its old bytes or holds complete new contents, no temporary file is left,
// and with room again every write lands.
#include <gtest/gtest.h>

#include <dirent.h>
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include <json/json.h>

#include "daemon/tarn_types.h"
#include "platform/media_playlists.h"
#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

const char kConf[] = "/etc/tarninfo.conf";
const char kSlots[] = "/usr/tarn/etc/audio/custom_slots.json";
const char *const kFiles[] = {kConf, kSlots, TARN_RADIO_FAVORITE, TARN_RADIO_USERDEF};

std::string Stations(int n, const std::string &prefix)
{
    Json::Value list(Json::objectValue);
    list["stations"] = Json::Value(Json::arrayValue);
    for (int i = 0; i < n; ++i) {
        Json::Value s(Json::objectValue);
        s["name"] = prefix + " station " + std::to_string(i);
        s["url"] = "http://127.0.0.1:9/" + prefix + std::to_string(i) + ".mp3";  // closed port
        s["desc"] = "a description long enough to make the file span several pages";
        list["stations"].append(s);
    }
    list["total"] = n;
    return Json::StyledWriter().write(list);
}

// Number of stations of a whole list, -1 for anything else.
int ListCount(const std::string &text)
{
    Json::Value v;
    if (!Json::Reader().parse(text, v) || !v.isObject() || !v["stations"].isArray() ||
        !v["total"].isIntegral() || v["total"].asInt() != static_cast<int>(v["stations"].size()))
        return -1;
    return v["total"].asInt();
}

bool HasLeftovers(const std::string &dir)
{
    bool found = false;
    if (DIR *d = opendir(dir.c_str())) {
        while (struct dirent *e = readdir(d)) {
            std::string n = e->d_name;
            found |= n.find("tmp") != std::string::npos || n.find('~') != std::string::npos;
        }
        closedir(d);
    }
    return found;
}

// Fills the folder's file system until freeBytes are left (-1: none made).
void Fill(const std::string &dir, long freeBytes)
{
    int fd = open((dir + "/filler").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ASSERT_GE(fd, 0);
    std::string chunk(4096, 'x');
    long written = 0;
    for (ssize_t n; (n = write(fd, chunk.data(), chunk.size())) > 0;)
        written += n;
    ASSERT_EQ(ENOSPC, errno);
    ASSERT_EQ(0, ftruncate(fd, written > freeBytes ? written - freeBytes : 0));
    close(fd);
}

// Every write the system makes to these files: the daemon saves the volume
// (on stop) and a custom slot; the web programs edit the radio lists and
// slots (in this process).
void WriteEverything(tarntest::Harness &h)
{
    ASSERT_EQ(0, h.Start()) << h.Error();
    std::string reply;
    EXPECT_EQ(0, h.Request(ACT_SET_VOLUME, "77", &reply, 1000));
    EXPECT_EQ(0, h.Request(ACT_SOURCE_RADIO, nullptr, &reply, 3000));
    EXPECT_EQ(0, h.Request(ACT_SAVE_CUSTOM, "2", &reply, 3000));
    EXPECT_EQ(0, h.Request(ACT_GET_STATUS, nullptr, &reply, 1000)) << "the daemon stopped serving";
    Json::Value st;
    ASSERT_TRUE(Json::Reader().parse(reply, st));
    EXPECT_EQ(77, st["Volume"].asInt());
    EXPECT_EQ(0, h.Stop()) << "the daemon did not end cleanly";

    Json::Value add(Json::arrayValue), s(Json::objectValue);
    s["name"] = "Added";
    s["url"] = "http://127.0.0.1:9/added.mp3";
    add.append(s);
    RadioListAdd(RADIO_LIST_FAVORITE, add);
    RadioListDelete(RADIO_LIST_FAVORITE, "0,1,2");
    RadioListEdit(RADIO_LIST_USERDEF, 1, s);
    TARNAudioCustomSet(3, "radio", "http://127.0.0.1:9/new.mp3", "New");
}

TEST(SettingsFiles, FullOrReadOnlyFileSystemKeepsEveryFileWhole)
{
    ASSERT_TRUE(tarntest::InPrivateNetns()) << "run under scripts/netns-run";
    if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
        GTEST_SKIP() << "no private mount namespace: " << strerror(errno);
    tarntest::Harness h;
    std::vector<std::string> mounted;
    for (const char *dir : {"/etc", "/usr/tarn/etc/audio"}) {
        mounted.push_back(h.Path(dir));
        ASSERT_EQ(0, mount("tmpfs", mounted.back().c_str(), "tmpfs", 0, "size=256k,mode=0755"))
            << mounted.back() << ": " << strerror(errno);
    }
    ASSERT_EQ(0, mkdir(h.Path(TARN_RADIO_DIR).c_str(), 0755));
    ASSERT_EQ(0, h.WriteFile(kConf, "admin_port=8080\naudio_volume=40\naudio_enable_equalizer=0\n"));
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_FAVORITE, Stations(120, "fav")));  // ~20 kB
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_USERDEF, Stations(3, "user")));
    ASSERT_EQ(0, TARNAudioCustomSet(1, "radio", "http://127.0.0.1:9/old.mp3", "Old"));

    // freeBytes < 0: no filler; in the last case (room again) every write lands.
    const struct { long freeBytes; bool readOnly; } cases[] = {
        {0, false}, {1024, false}, {4096, false}, {12288, false}, {-1, true}, {-1, false}};
    for (const auto &c : cases) {
        SCOPED_TRACE("free bytes " + std::to_string(c.freeBytes) + (c.readOnly ? ", read-only" : ""));
        bool withRoom = &c == &cases[5];
        std::map<std::string, std::string> before;
        for (const char *f : kFiles)
            before[f] = h.ReadFile(f);
        for (const std::string &dir : mounted) {
            if (c.freeBytes >= 0)
                Fill(dir, c.freeBytes);
            ASSERT_EQ(0, mount("tmpfs", dir.c_str(), "tmpfs", MS_REMOUNT | (c.readOnly ? MS_RDONLY : 0),
                               "size=256k,mode=0755")) << dir << ": " << strerror(errno);
        }
        WriteEverything(h);

        for (const char *f : kFiles) {
            std::string now = h.ReadFile(f);
            if (now == before[f])
                continue;
            EXPECT_FALSE(c.readOnly) << f << " changed on a read-only file system";
            if (f == kConf) {
                EXPECT_EQ("admin_port=8080\naudio_volume=\"77\"\naudio_enable_equalizer=0\n", now);
            } else if (f == kSlots) {
                Json::Value v;
                EXPECT_TRUE(Json::Reader().parse(now, v) &&
                            v["slots"]["1"]["second"].asString() == "http://127.0.0.1:9/old.mp3")
                    << "custom slots damaged:\n" << now;
            } else {
                EXPECT_GE(ListCount(now), 0) << f << " is no whole list:\n" << now.substr(0, 400);
            }
        }
        for (const std::string &dir : {mounted[0], mounted[1], h.Path(TARN_RADIO_DIR)})
            EXPECT_FALSE(HasLeftovers(dir)) << "temporary file left in " << dir;
        for (const std::string &dir : mounted)
            unlink((dir + "/filler").c_str());
        if (withRoom) {
            EXPECT_NE(std::string::npos, h.ReadFile(kConf).find("audio_volume=\"77\""));
            EXPECT_EQ(ListCount(before[TARN_RADIO_FAVORITE]) + 1 - 3, ListCount(h.ReadFile(TARN_RADIO_FAVORITE)));
            std::string type, second, third;
            EXPECT_EQ(0, TARNAudioCustomGet(3, type, second, third));
            EXPECT_EQ("http://127.0.0.1:9/new.mp3", second);
            EXPECT_EQ(0, TARNAudioCustomGet(2, type, second, third));
            EXPECT_EQ("radio", type);
        }
        if (::testing::Test::HasFailure()) {
            fprintf(stderr, "--- daemon log ---\n%s\n", h.Log().c_str());
            break;
        }
    }
    for (const std::string &dir : mounted)
        umount2(dir.c_str(), MNT_DETACH);
}

}  // namespace
