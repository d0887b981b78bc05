#include "platform/device/NamedSemaphore.h"

#include "support/DeviceTest.h"

#include <semaphore.h>

namespace ost::platform {
namespace {

class NamedSemaphoreTest : public test::DeviceTest {};

TEST_F(NamedSemaphoreTest, ExistsOnceItIsCreated) {
    EXPECT_EQ(namedSemaphoreExists("ostrandd.fb_check"), false);
    ASSERT_TRUE(createNamedSemaphore("ostrandd.fb_check", 0400, 0));
    EXPECT_EQ(namedSemaphoreExists("ostrandd.fb_check"), true);
    EXPECT_EQ(test::tree("/dev/shm"), "-r-------- 0:0 sem.ostrandd.fb_check\n");
    EXPECT_TRUE(createNamedSemaphore("ostrandd.fb_check", 0400, 0)) << "one that exists will do";

    EXPECT_EQ(createNamedSemaphore("not/one", 0400, 0).error(), EINVAL);
    EXPECT_EQ(namedSemaphoreExists("another"), false);
}

} // namespace
} // namespace ost::platform
