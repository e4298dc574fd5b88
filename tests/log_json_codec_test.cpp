#include "protocol/log_json_codec.h"
#include "tests/memory_platform.h"
#include "tests/recording_handlers.h"

#include <gtest/gtest.h>
#include <tuple>

namespace
{

TEST(Dispatch, AnswersEachControlTextAsItsRowSays)
{
    const char *const no_id = "error msgid=-1.$";
    for (const auto &[control, result, line, last, commands] : {
             std::tuple<const char *, int, const char *, const char *, const char *>{
                 nullptr, -1, "get_msgid para null error$", no_id, ""},
             {"", -1, "get_msgid para len error$", no_id, ""},
             {"{", -1, "cJSON_Parse error$", no_id, ""},
             {"{}", -1, "cannot find msgid item$", no_id, ""},
             {"[\"msgid\"]", -1, "cannot find msgid item$", no_id, ""},
             {R"({"msgid":3})", -1, "cannot find msgid item$", no_id, ""},
             {R"({"msgid":{"msgid":"3"}})", -1, "cannot find msgid item$", no_id, ""},
             {R"({"msgid":"-1"})", -1, "log_json_codec msgid=-1$", no_id, ""},
             {R"({"msgid":"abc"})", -1, "log_json_codec msgid=abc$", "unknown msgid 0,pls check.$", ""},
             {R"({"msgid":"12abc"})", -1, "return msgid=12.$", "unknown msgid 12,pls check.$", ""},
             {R"({"msgid":"4294967299"})", -1, "msgid=4294967299$", "msgid 2147483647,pls check.$", ""}, /* 2^32 + 3 */
             {R"({"msgid":"9"})", 0, "msgid=9$", "log_dl_msg_handle_cmd,msgid 9 hander is null$", ""},
             {R"({"MSGID":"3"})", 0, "msgid=3$", "return msgid=3.$", R"(3:{"MSGID":"3"}:xy;)"},
             {R"({"msgid":" 7"})", 0, "msgid= 7$", "return msgid=7.$", R"(7:{"msgid":" 7"}:xy;)"},
             {R"({"msgid":"11"})", 0, "msgid=11$", "return msgid=11.$", R"(11:{"msgid":"11"}:xy;)"},
         }) {
        g_platform = {};
        g_commands.clear();
        EXPECT_EQ(result, log_dl_msg_handle_cmd(control, reinterpret_cast<const unsigned char *>("xy"), 2));
        EXPECT_TRUE(g_platform.logged(line) && g_platform.log.ends_with(last + std::string("|"))) << g_platform.log;
        EXPECT_EQ(commands, g_commands);
    }
}

} // namespace
