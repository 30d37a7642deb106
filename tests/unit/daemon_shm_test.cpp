// Status segment operations: create/attach, re-attach, detach, remove and
// their failure messages.
#include <gtest/gtest.h>

#include <cstring>
#include <sys/ipc.h>
#include <sys/shm.h>

#include "daemon/shm.h"
#include "tests/harness/harness.h"

namespace {

class ShmTest : public ::testing::Test {
protected:
    tarntest::Harness h;
    int key = 0;
    void SetUp() override
    {
        h.ClearLog();
        key = h.PlayerKey() + 100;
        int id = shmget(key, 0, 0);
        if (id >= 0)
            shmctl(id, IPC_RMID, nullptr);
    }
    void TearDown() override
    {
        int id = shmget(key, 0, 0);
        if (id >= 0)
            shmctl(id, IPC_RMID, nullptr);
    }
};

TEST_F(ShmTest, CreateReattachKeepsContentsAndPermissions)
{
    char *p = static_cast<char *>(ShmCreateAttach(key, 4640, 1));
    ASSERT_NE(nullptr, p);
    memset(p, 0x5a, 4640);
    EXPECT_EQ(0, ShmDetach(p));

    struct shmid_ds ds;
    int id = shmget(key, 0, 0);
    ASSERT_GE(id, 0);
    ASSERT_EQ(0, shmctl(id, IPC_STAT, &ds));
    EXPECT_EQ(0666u, ds.shm_perm.mode & 0777u);
    EXPECT_EQ(4640u, ds.shm_segsz);

    // Attaching again (with or without create) sees the old contents.
    char *q = static_cast<char *>(ShmCreateAttach(key, 4640, 0));
    ASSERT_NE(nullptr, q);
    EXPECT_EQ(0x5a, q[0]);
    EXPECT_EQ(0x5a, q[4639]);
    EXPECT_EQ(0, ShmDetach(q));
    EXPECT_EQ("", h.Log());
}

TEST_F(ShmTest, MissingOrTooSmallSegmentFails)
{
    EXPECT_EQ(nullptr, ShmCreateAttach(key, 4640, 0));
    EXPECT_EQ(1, h.CountLog("shm:35 Failed to create shared memory. key[" + std::to_string(key) +
                            "], size[4640], ["));
    ASSERT_EQ(0, tarntest::Harness::CreateSegment(key, 100));
    EXPECT_EQ(nullptr, ShmCreateAttach(key, 4640, 1));
    EXPECT_EQ(2, h.CountLog("shm:35 Failed to create shared memory."));
}

TEST_F(ShmTest, RemoveAndDetachFailures)
{
    EXPECT_EQ(-1, ShmRemove(key, 4640));
    EXPECT_EQ(1, h.CountLog("shm:66 Get shared memory fail. Might not exist.("));
    void *p = ShmCreateAttach(key, 4640, 1);
    ASSERT_NE(nullptr, p);
    EXPECT_EQ(0, ShmDetach(p));
    EXPECT_EQ(-1, ShmDetach(p));  // not attached any more
    EXPECT_EQ(1, h.CountLog("shm:52 Failed to detach shared memory."));
    EXPECT_EQ(0, ShmRemove(key, 4640));
    EXPECT_LT(shmget(key, 0, 0), 0);
}

}  // namespace
