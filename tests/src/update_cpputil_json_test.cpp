// UpdateUtil: JSON files and string lists.
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "sandbox.h"
#include "update_cpputil.h"

namespace {

using kytotest::PathExists;
using kytotest::ReadFile;
using kytotest::SyslogContains;
using kytotest::WriteFile;
using Strings = std::vector<std::string>;

class UpdateUtilJsonTest : public kytotest::SandboxTest {};

TEST_F(UpdateUtilJsonTest, BrokenFileIsDeletedAndReported) {
    const char* path = "/tmp/state.json";
    for (const std::string content : {"{", "", "{\"a\": }", "not json"}) {
        SCOPED_TRACE("content: " + content);
        kytotest::ClearSyslog();
        WriteFile(path, content);
        Json::Value root;
        EXPECT_EQ(UpdateUtil::ParseJsonRootFromFile(path, root), 0);
        EXPECT_FALSE(PathExists(path));
        EXPECT_TRUE(SyslogContains("update_cpputil:", LOG_ERR));
        EXPECT_TRUE(SyslogContains(" Parse failed", LOG_ERR));
    }
}

TEST_F(UpdateUtilJsonTest, MissingFileAndNullPath) {
    Json::Value root;
    EXPECT_EQ(UpdateUtil::ParseJsonRootFromFile("/tmp/absent.json", root), 0);
    EXPECT_TRUE(SyslogContains(" inFile failed", LOG_ERR));
    EXPECT_FALSE(SyslogContains("Parse failed"));

    EXPECT_EQ(UpdateUtil::ParseJsonRootFromFile(nullptr, root), 0);
    EXPECT_TRUE(SyslogContains(" bad parameters!", LOG_ERR));
    EXPECT_EQ(UpdateUtil::DumpJsonRootToFile(nullptr, root), 0);
    EXPECT_TRUE(SyslogContains(" bad parameter!", LOG_ERR));
}

TEST_F(UpdateUtilJsonTest, AnyJsonValueIsAcceptedAsRoot) {
    WriteFile("/tmp/list.json", "[1, 2]");
    Json::Value root;
    ASSERT_EQ(UpdateUtil::ParseJsonRootFromFile("/tmp/list.json", root), 1);
    ASSERT_TRUE(root.isArray());
    EXPECT_EQ(root.size(), 2u);
    EXPECT_EQ(root[1].asInt(), 2);
    EXPECT_TRUE(PathExists("/tmp/list.json"));
}

TEST_F(UpdateUtilJsonTest, DumpWritesCompactTextInPlace) {
    EXPECT_EQ(UpdateUtil::DumpJsonRootToFile("/tmp/null.json", Json::Value()), 1);
    EXPECT_EQ(ReadFile("/tmp/null.json"), "null\n");

    // The file is rewritten in place: a second name of the same file sees the new text.
    const char* path = "/tmp/info.json";
    WriteFile(path, std::string(4096, 'x'));
    ASSERT_EQ(link(path, "/tmp/info.link"), 0);
    Json::Value root;
    root["updateType"] = "smallupdate";
    root["list"].append("a");
    ASSERT_EQ(UpdateUtil::DumpJsonRootToFile(path, root), 1);
    EXPECT_EQ(ReadFile("/tmp/info.link"), "{\"list\":[\"a\"],\"updateType\":\"smallupdate\"}\n");

    Json::Value back;
    ASSERT_EQ(UpdateUtil::ParseJsonRootFromFile(path, back), 1);
    EXPECT_EQ(back, root);
}

TEST_F(UpdateUtilJsonTest, DumpToUnopenablePathFailsAndDeletesNothing) {
    EXPECT_EQ(UpdateUtil::DumpJsonRootToFile("/tmp/no/such/dir/x.json", Json::Value(1)), 0);
    EXPECT_TRUE(SyslogContains(" Failed to open /tmp/no/such/dir/x.json", LOG_ERR));
}

TEST_F(UpdateUtilJsonTest, JsonArrayToStrings) {
    Json::Value mixed(Json::arrayValue);
    mixed.append("a");
    mixed.append(1);
    Json::Value two(Json::arrayValue);
    two.append("b");
    two.append("a");
    Json::Value object;
    object["k"] = "v";
    struct Case {
        const char* name;
        Json::Value input;
        int result;
        Strings out;
        const char* message;
    } cases[] = {
        {"null", Json::Value(), 0, {}, " bad parameter!"},
        {"object", object, 0, {}, " bad parameter!"},
        {"string", Json::Value("a"), 0, {}, " bad parameter!"},
        {"mixed", mixed, 0, {}, " not a string"},
        {"empty", Json::Value(Json::arrayValue), 1, {}, nullptr},
        {"strings", two, 1, {"b", "a"}, nullptr},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        kytotest::ClearSyslog();
        Strings out = {"stale"};
        EXPECT_EQ(UpdateUtil::JsonArray2StringVector(c.input, out), c.result);
        EXPECT_EQ(out, c.out);
        if (c.message) {
            EXPECT_TRUE(SyslogContains(c.message, LOG_ERR));
        }
    }
}

TEST_F(UpdateUtilJsonTest, StringsAppendToJsonArray) {
    Json::Value array;
    EXPECT_EQ(UpdateUtil::StringVector2JsonArray({}, array), 1);
    EXPECT_TRUE(array.isNull());
    UpdateUtil::StringVector2JsonArray({"x", "y"}, array);
    UpdateUtil::StringVector2JsonArray({"z"}, array);
    Strings out;
    ASSERT_EQ(UpdateUtil::JsonArray2StringVector(array, out), 1);
    EXPECT_EQ(out, (Strings{"x", "y", "z"}));
}

TEST_F(UpdateUtilJsonTest, CompareVectorIgnoresOrderButNotMultiplicity) {
    struct Case {
        Strings a, b;
        int equal;
    } cases[] = {
        {{}, {}, 1},
        {{"a", "b", "b"}, {"b", "a", "b"}, 1},
        {{"a", "b", "b"}, {"a", "a", "b"}, 0},
        {{"a", "b"}, {"a", "b", "b"}, 0},
        {{"A"}, {"a"}, 0},
        {{"a "}, {"a"}, 0},
        {{"ab", "a"}, {"a", "ab"}, 1},
    };
    for (const Case& c : cases) {
        Strings a = c.a;
        EXPECT_EQ(UpdateUtil::CompareVector(a, c.b), c.equal)
            << testing::PrintToString(c.a) << " vs " << testing::PrintToString(c.b);
        EXPECT_EQ(a, c.a);  // the caller's list keeps its order
    }
}

}  // namespace
