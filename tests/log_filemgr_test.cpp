#include "core/log_filemgr.h"
#include "tests/memory_platform.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace
{

TEST(Files, AreWrittenReadAndRemoved)
{
    g_platform = {};
    char dir[] = "/tmp/filesXXXXXX";
    ASSERT_NE(nullptr, mkdtemp(dir));
    const std::string path = std::string(dir) + "/a";
    EXPECT_EQ(5, log_write_whole_file(path.c_str(), "12345", 5));
    FILE *file = log_open_file(path.c_str(), kFileAppendReadBinary);
    EXPECT_EQ(3, log_write_file_full(file, "678", 3));
    EXPECT_EQ(0, log_write_file_full(file, "9", 0));
    EXPECT_EQ(-7, log_write_file_full(file, "9", -7));
    EXPECT_EQ(1, log_sync_file(file));
    EXPECT_EQ(1, log_seek_file(file, -2, 5)); /* any origin but 0 and 1 is the end */
    char text[16] = {};
    EXPECT_EQ(2, log_read_file(file, text, sizeof text));
    EXPECT_STREQ("78", text);
    EXPECT_EQ(1, log_close_file(file));
    EXPECT_EQ(8, log_get_file_size(path.c_str()));
    EXPECT_EQ(0, pel_remove_file(dir));
    file = log_open_file(path.c_str(), kFileReadBinary);
    EXPECT_EQ(0, log_write_file_full(file, "9", 1));
    EXPECT_EQ(1, log_sync_file(file));
    log_close_file(file);
    file = log_open_file("/dev/full", kFileWriteBinary);
    EXPECT_EQ(0, log_write_file_full(file, std::string(9000, 'x').data(), 9000));
    log_close_file(file);
    const std::string to = path + "b";
    EXPECT_EQ(1, pel_rename_file(path.c_str(), to.c_str()));
    EXPECT_EQ(8, log_read_whole_file(to.c_str(), text, sizeof text));
    EXPECT_EQ(1, pel_remove_file(to.c_str()));
    EXPECT_EQ(1, pel_remove_file(dir));
    g_platform.take_log();
    EXPECT_EQ(1, pel_remove_file(dir));
    EXPECT_EQ(0, log_get_file_size(dir));
    EXPECT_EQ("6 log_filemgr pel_remove_file name " + std::string(dir) + "$|6 log_filemgr " + dir +
                  " not exsit$|6 log_filemgr log_get_file_size get failed$|",
              g_platform.log);
    EXPECT_EQ(nullptr, log_open_file(to.c_str(), 8));
    EXPECT_NE(0, access(to.c_str(), F_OK));
}

} // namespace
