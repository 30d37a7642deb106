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

Json::Value MakeList(int n)
{
    Json::Value list(Json::objectValue);
    for (int i = 0; i < n; i++) {
        list["stations"][i]["name"] = "station " + std::to_string(i);
        list["stations"][i]["url"] = "http://stream.example/" + std::to_string(i);
        list["stations"][i]["desc"] = std::string(40, 'd');
    }
    list["total"] = n;
    return list;
}

TEST(RadioListSaveFullDisk, FailedSaveLeavesTheOldList)
{
    tarntest::Harness h;
    if (unshare(CLONE_NEWNS) != 0)
        GTEST_SKIP() << "no private mount namespace: " << strerror(errno);
    ASSERT_EQ(0, mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr)) << strerror(errno);
    std::string dir = h.Path(TARN_RADIO_DIR), path = dir + "/favorite.json";
    ASSERT_EQ(0, h.WriteFile(TARN_RADIO_DIR "/.keep", ""));
    if (mount("tmpfs", dir.c_str(), "tmpfs", 0, "size=64k,mode=0755") != 0)
        GTEST_SKIP() << "cannot mount tmpfs: " << strerror(errno);

    Json::Value small = MakeList(3), big = MakeList(200);
    ASSERT_EQ(0, RadioListSave(path.c_str(), small));
    const std::string before = h.ReadFile(TARN_RADIO_FAVORITE);
    ASSERT_EQ(Json::StyledWriter().write(small), before);

    // Fill the file system (bounded: 1 MiB at most, the rest byte by byte).
    int fd = open((dir + "/filler").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    char block[1024] = {0};
    for (int i = 0; fd >= 0 && i < 1024 + 4096; i++)
        if (write(fd, block, i < 1024 ? sizeof(block) : 1) <= 0 && i >= 1024)
            break;
    ASSERT_EQ(0, close(fd));

    h.ClearLog();
    EXPECT_EQ(-1, RadioListSave(path.c_str(), big));
    EXPECT_EQ(1, h.CountLog("Failed to fwrite")) << h.Log();
    EXPECT_EQ(before, h.ReadFile(TARN_RADIO_FAVORITE));
    // Through an edit: still success, but the log names the file and the
    // caller can tell that nothing was saved; the old list is intact.
    bool saved = true;
    EXPECT_EQ(0, RadioListAdd(2, big["stations"], &saved));
    EXPECT_FALSE(saved);
    EXPECT_EQ(1, h.CountLog("Could not save list of type: 2 to [" + path + "]")) << h.Log();
    saved = true;
    EXPECT_EQ(0, RadioListEdit(2, 0, big["stations"][0], &saved));
    EXPECT_FALSE(saved);
    EXPECT_EQ(before, h.ReadFile(TARN_RADIO_FAVORITE));
    std::string out;  // no temporary file is left behind
    ASSERT_EQ(0, h.Run({"/bin/ls", "-A", dir}, &out));
    EXPECT_EQ("favorite.json\nfiller\n", out);

    // With room again the same save succeeds.
    ASSERT_EQ(0, unlink((dir + "/filler").c_str()));
    ASSERT_EQ(0, RadioListSave(path.c_str(), big));
    EXPECT_EQ(Json::StyledWriter().write(big), h.ReadFile(TARN_RADIO_FAVORITE));
    ASSERT_EQ(0, RadioListSave(path.c_str(), small));
    EXPECT_EQ(0, RadioListDelete(2, "0", &saved));
    EXPECT_TRUE(saved) << h.Log();
    EXPECT_EQ(0, umount2(dir.c_str(), MNT_DETACH));
}

}  // namespace
