#include "protocol/log_json_codec.h"
#include "tests/memory_platform.h"
#include "tests/recording_handlers.h"

#include <gtest/gtest.h>
#include <tuple>

namespace
{

TEST(Dispatch, AnswersEachControlTextAsItsRowSays)
{
    const std::string no_id = "log_dl_msg_handle_cmd:error msgid=-1.$";
    const std::string none = "cannot find msgid item$ log_json_get_msgid return msgid=-1.$ " + no_id;
    const auto id = [](const char *text, const char *n) {
        return std::string("msgid=") + text + "$ log_json_get_msgid return msgid=" + n + ".$";
    };
    const auto unknown = [](const char *n) {
        return std::string(" log_dl_msg_handle_cmd,unknown msgid ") + n + ",pls check.$";
    };
    for (const auto &[control, result, lines, commands] : {
             std::tuple<const char *, int, std::string, const char *>{
                 nullptr, -1, "log_json_get_msgid para null error$ " + no_id, ""},
             {"", -1, "log_json_get_msgid para len error$ " + no_id, ""},
             {"{", -1, "cJSON_Parse error$ " + no_id, ""},
             {"{}", -1, none, ""},
             {"[\"msgid\"]", -1, none, ""},
             {R"({"msgid":3})", -1, none, ""},
             {R"({"msgid":{"msgid":"3"}})", -1, none, ""},
             {R"({"msgid":"-1"})", -1, id("-1", "-1") + ' ' + no_id, ""},
             {R"({"msgid":"abc"})", -1, id("abc", "0") + unknown("0"), ""},
             {R"({"msgid":"12abc"})", -1, id("12abc", "12") + unknown("12"), ""},
             {R"({"msgid":"4294967299"})", -1, id("4294967299", "2147483647") + unknown("2147483647"),
              ""}, /* 2^32 + 3 */
             {R"({"msgid":"9"})", 0, id("9", "9") + " log_dl_msg_handle_cmd,msgid 9 hander is null$", ""},
             {R"({"MSGID":"3"})", 0, id("3", "3"), R"(3:{"MSGID":"3"}:xy;)"},
             {R"({"msgid":" 7"})", 0, id(" 7", "7"), R"(7:{"msgid":" 7"}:xy;)"},
             {R"({"msgid":"11"})", 0, id("11", "11"), R"(11:{"msgid":"11"}:xy;)"},
         }) {
        g_platform = {};
        g_commands.clear();
        EXPECT_EQ(result, log_dl_msg_handle_cmd(control, reinterpret_cast<const unsigned char *>("xy"), 2));
        std::string expected = "6 log_json_codec enter log_dl_msg_handle_cmd.$ " + lines;
        for (std::size_t at = 0; (at = expected.find("$ ", at)) != std::string::npos;)
            expected.replace(at, 2, "$|6 log_json_codec ");
        EXPECT_EQ(expected + "|", g_platform.log);
        EXPECT_EQ(commands, g_commands);
    }
}

} // namespace
