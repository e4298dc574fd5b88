#include "core/log_filemgr.h"
#include "tests/memory_platform.h"

#include <gtest/gtest.h>

namespace
{

TEST(Files, FailByTheirResult)
{
    g_platform = {};
    FILE *unwritable = log_open_file("/dev/null", kFileReadBinary);
    EXPECT_EQ(0, log_write_file_full(unwritable, "9", 1));
    EXPECT_EQ(0, log_sync_file(unwritable)); /* there is nothing to sync */
    EXPECT_EQ(0, log_seek_file(unwritable, -1, 0));
    log_close_file(unwritable);
    FILE *full = log_open_file("/dev/full", kFileWriteBinary);
    EXPECT_EQ(0, log_write_file_full(full, "9", 1));
    log_close_file(full);
    char text[4];
    EXPECT_EQ(0, log_read_whole_file("/no/file", text, 4) + log_write_whole_file("/no/file", text, 4));
    EXPECT_EQ(0, pel_rename_file("/no/file", "/no/other"));
    EXPECT_EQ(nullptr, log_open_file("/dev/null", 8));
    EXPECT_EQ(0, log_close_file(nullptr) + log_sync_file(nullptr) + log_read_file(nullptr, text, 4));
    EXPECT_EQ("", g_platform.take_log());
    EXPECT_EQ(1, pel_remove_file("/no/file"));
    EXPECT_EQ(0, log_get_file_size("/no/file"));
    EXPECT_EQ("6 log_filemgr pel_remove_file name /no/file$|6 log_filemgr /no/file not exsit$|6 log_filemgr "
              "log_get_file_size get failed$|",
              g_platform.take_log());
    EXPECT_EQ(0, log_seek_file(nullptr, 0, 0) + pel_remove_file(nullptr) + pel_rename_file(nullptr, "/no/file"));
}

} // namespace
