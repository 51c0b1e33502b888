#include <gtest/gtest.h>

#include <cstring>
#include <thread>
#include <vector>

#include "sl/sl.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

class SLMemory : public ::testing::Test {
protected:
    void SetUp() override
    {
        SLStringInitialize();
        SLHandleInitialize();
    }
    void TearDown() override
    {
        SLHandleCleanup();
        SLStringCleanup();
        EXPECT_EQ(slLiveStringCount(), 0u);
    }
};

TEST_F(SLMemory, StringsAreAtLeastFourBytesAndTracked)
{
    for (unsigned size : {0u, 3u, 4u, 100u}) {
        auto* data = static_cast<unsigned char*>(SLCreateString(size));
        ASSERT_NE(data, nullptr);
        std::memset(data, 0xAB, size < 4 ? 4 : size); // ASan proves the area is usable
        EXPECT_EQ(slLiveStringCount(), 1u);
        SLDeleteString(data);
        EXPECT_EQ(slLiveStringCount(), 0u);
    }
    SLDeleteString(nullptr);
}

TEST_F(SLMemory, StringConversions)
{
    DmiString* empty = NewDmiString("");
    ASSERT_NE(empty, nullptr);
    EXPECT_EQ(dmiStringLength(empty), 0u);
    char* text = NewCString(empty);
    ASSERT_NE(text, nullptr);
    EXPECT_STREQ(text, "");

    DmiString* name = NewDmiString("Zorek");
    EXPECT_EQ(dmiStringLength(name), 5u);
    EXPECT_EQ(std::memcmp(dmiStringText(name), "Zorek", 5), 0);
    char* back = NewCString(name);
    EXPECT_STREQ(back, "Zorek");

    EXPECT_EQ(NewCString(nullptr), nullptr);
    EXPECT_EQ(NewDmiString(nullptr), nullptr);
    for (void* s : {static_cast<void*>(empty), static_cast<void*>(text), static_cast<void*>(name),
                    static_cast<void*>(back)})
        SLDeleteString(s);
}

TEST_F(SLMemory, HandleConfirmSizes)
{
    struct Case {
        unsigned asked, expected;
    } cases[] = {{0, 8192}, {8191, 8192}, {8192, 8192}, {8193, 8193}, {20000, 20000}};
    for (const Case& c : cases) {
        SLHandle* h = SLCreateHandle(c.asked);
        ASSERT_NE(h, nullptr);
        EXPECT_EQ(h->confirmSize, c.expected) << c.asked;
        h->confirm[c.expected - 1] = 1; // the last byte belongs to the handle
        EXPECT_EQ(SLCommandBuffer(h), static_cast<void*>(h));
        EXPECT_EQ(SLConfirmBuffer(h), static_cast<void*>(h->confirm));
        SLDestroyHandle(h);
    }
    EXPECT_EQ(SLCreateHandle(0xFFFFFFF0u), nullptr) << "a size that would wrap is refused";
}

TEST_F(SLMemory, DuplicateMovesBetweenLists)
{
    SLHandleListHead queue;
    SLHandle* original = SLCreateHandle(9000);
    std::memset(original->command, 7, SL_COMMAND_SIZE);
    std::memset(original->confirm, 9, original->confirmSize);
    SLHandle* copy = SLDupHandle(original);
    ASSERT_NE(copy, nullptr);
    EXPECT_EQ(copy->confirmSize, 9000u);
    EXPECT_EQ(std::memcmp(copy->command, original->command, SL_COMMAND_SIZE), 0);
    EXPECT_EQ(std::memcmp(copy->confirm, original->confirm, 9000), 0);

    SLUnlinkHandle(copy);
    SLUnlinkHandle(copy); // twice leaves it unlinked and the list intact
    EXPECT_EQ(copy->next, copy);
    SLEnqueueHandle(queue.get(), copy);
    EXPECT_EQ(slHandleListLength(queue.get()), 1u);
    EXPECT_EQ(SLHeadHandle(queue.get()), copy);
    EXPECT_EQ(SLDupHandle(nullptr), nullptr);
    SLDestroyHandle(original);
    SLDestroyAllHandles(queue.get());
    EXPECT_EQ(SLHeadHandle(queue.get()), nullptr);
}

TEST_F(SLMemory, QueueOrder)
{
    SLHandleListHead queue;
    EXPECT_EQ(SLHeadHandle(queue.get()), nullptr);
    SLHandle* a = SLCreateHandle(0);
    SLHandle* b = SLCreateHandle(0);
    SLUnlinkHandle(a);
    SLUnlinkHandle(b);
    SLEnqueueHandle(queue.get(), a);
    SLEnqueueHandle(queue.get(), b);
    EXPECT_EQ(SLHeadHandle(queue.get()), a);
    SLDestroyHandle(a);
    EXPECT_EQ(SLHeadHandle(queue.get()), b);
    SLDestroyHandle(b);
    EXPECT_EQ(SLHeadHandle(queue.get()), nullptr);
}

TEST_F(SLMemory, StringCleanupFreesQueuedHandles)
{
    SLHandleListHead queue;
    for (int i = 0; i < 3; ++i) {
        SLHandle* h = SLCreateHandle(0);
        SLUnlinkHandle(h);
        SLEnqueueHandle(queue.get(), h);
    }
    SLCreateString(10);
    SLHandleCleanup();
    EXPECT_EQ(slLiveStringCount(), 4u) << "handles on another list survive the handle cleanup";
    SLStringCleanup();
    EXPECT_EQ(slLiveStringCount(), 0u);
    SLStringInitialize();
    SLHandleInitialize();
}

TEST_F(SLMemory, ConcurrentCreateAndDestroy)
{
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([] {
            for (int i = 0; i < 2000; ++i)
                SLDestroyHandle(SLCreateHandle(0));
        });
    for (auto& t : threads)
        t.join();
    EXPECT_EQ(slLiveStringCount(), 0u);
}

} // namespace
