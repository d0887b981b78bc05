#include "platform/base/MessageFormat.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace ost::platform {
namespace {

TEST(MessageFormat, AnErrnoIsANumberOrItsText) {
    EXPECT_EQ("2: No such file or directory, No such file or directory",
              formatMessage("%d: %s, %@", Errno(ENOENT), Errno(ENOENT), Errno(ENOENT)));
}

} // namespace
} // namespace ost::platform
