// Saving a radio list on a full disk: the list file is replaced whole or not
// at all. The radio directory is a 64 KiB tmpfs mounted in a private mount
// namespace of this test process.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sched.h>
#include <string>
#include <sys/mount.h>
#include <unistd.h>

#include <json/json.h>

#include "source/radiolist.h"
#include "tests/harness/harness.h"

namespace {

Json::Value MakeList(int n, const std::string &prefix)
{
    Json::Value list(Json::objectValue);
    list["stations"] = Json::Value(Json::arrayValue);
    for (int i = 0; i < n; i++) {
        Json::Value s(Json::objectValue);
        s["name"] = prefix + " station " + std::to_string(i);
        s["url"] = "http://stream.example/" + prefix + "/" + std::to_string(i);
        s["desc"] = std::string(40, 'd');
        list["stations"].append(s);
    }
    list["total"] = n;
    return list;
}

// Fills the file system holding path until it is full; returns bytes written.
long FillUp(const std::string &path)
{
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (fd < 0)
        return -1;
    char block[1024];
    memset(block, 'f', sizeof(block));
    long total = 0;
    for (int i = 0; i < 1024; i++) {  // bounded: 1 MiB at most
        ssize_t n = write(fd, block, sizeof(block));
        if (n <= 0)
            break;
        total += n;
    }
    // Fill the last partial block byte by byte.
    for (int i = 0; i < 4096; i++) {
        if (write(fd, block, 1) != 1)
            break;
        total++;
    }
    close(fd);
    return total;
}

TEST(RadioListSaveFullDisk, FailedSaveLeavesTheOldList)
{
    tarntest::Harness h;
    ASSERT_TRUE(h.Error().empty()) << h.Error();
    if (unshare(CLONE_NEWNS) != 0)
        GTEST_SKIP() << "no private mount namespace: " << strerror(errno);
    ASSERT_EQ(0, mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) << strerror(errno);
    std::string dir = h.Path(TARN_RADIO_DIR);
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_DIR "/.keep", ""));
    if (mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=64k,mode=0755") != 0)
        GTEST_SKIP() << "cannot mount tmpfs: " << strerror(errno);

    std::string path = dir + "/favorite.json";
    Json::Value small = MakeList(3, "small");
    ASSERT_EQ(0, RadioListSave(path.c_str(), small));
    const std::string before = h.ReadFile(TARN_RADIO_FAVORITE);
    Json::StyledWriter writer;
    ASSERT_EQ(writer.write(small), before);

    ASSERT_GT(FillUp(dir + "/filler"), 0);
    Json::Value big = MakeList(200, "big");  // far more than the room left
    h.ClearLog();
    EXPECT_EQ(-1, RadioListSave(path.c_str(), big));
    EXPECT_EQ(1, h.CountLog("radiolist:")) << h.Log();
    EXPECT_EQ(1, h.CountLog("Failed to fwrite"));
    EXPECT_EQ(before, h.ReadFile(TARN_RADIO_FAVORITE));

    // Through the edit operations: logged, still success, old list intact.
    Json::Value more(Json::arrayValue);
    for (const Json::Value &s : big["stations"])
        more.append(s);
    h.ClearLog();
    EXPECT_EQ(0, RadioListAdd(2, more));
    EXPECT_EQ(1, h.CountLog("Could not save list of type: 2"));
    EXPECT_EQ(before, h.ReadFile(TARN_RADIO_FAVORITE));

    // No temporary file is left behind.
    std::string out;
    ASSERT_EQ(0, h.Run({"/bin/ls", "-A", dir}, &out));
    EXPECT_EQ("favorite.json\nfiller\n", out);  // the tmpfs hides .keep

    // With room again the same save succeeds with the plain text.
    ASSERT_EQ(0, unlink((dir + "/filler").c_str()));
    ASSERT_EQ(0, RadioListSave(path.c_str(), big));
    EXPECT_EQ(writer.write(big), h.ReadFile(TARN_RADIO_FAVORITE));

    EXPECT_EQ(0, umount2(dir.c_str(), MNT_DETACH));
}

}  // namespace
