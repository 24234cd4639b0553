// CustomBugFix: merging patch-list entries (build 5644 in the sandbox's version file).
#include "custombugfix.h"
#include "engine_fixtures.h"

namespace kytotest {
namespace {

const auto J = ParseJson;

Json::Value SmallOnly(int version, const Json::Value& restart = "none") {
    return EntryJson(version, {ProjJson("smallupdate", version)}, restart);
}

using CustomBugFixTest = SandboxTest;

// How newer entries fold into one result is seen through the patch-list lookup; here: what
// an older entry may and may not change, and every way an entry is refused.
TEST_F(CustomBugFixTest, OldEntriesOnlyRaiseTheNumberButNeedAllKeys) {
    CustomBugFix fix(5);
    EXPECT_EQ(fix.Merge(SmallOnly(3, "reboot")), 1);
    EXPECT_EQ(fix.Merge(EntryJson(5, {ProjJson("webui", 5)}, "all_service", true, true)), 1);
    EXPECT_EQ(fix.m_smallFixNumber, 5);
    EXPECT_FALSE(fix.m_blFlashUpdate || fix.m_blConfigUpdate || fix.m_blNeedReboot ||
                 fix.m_blRestartAllService);
    EXPECT_TRUE(fix.m_smallUpdateDeb.empty() && fix.m_installDebs.empty());

    // A missing key, or an entry or version jsoncpp cannot read: refused, nothing thrown.
    std::vector<Json::Value> bad = {J("[1, 2]")};
    for (const char* key : {"version", "proj", "flash_upgrade", "config_upgrade", "restart"}) {
        bad.push_back(SmallOnly(2));
        bad.back().removeMember(key);
    }
    bad.push_back(SmallOnly(7));
    bad.back()["version"] = "seven";
    for (const Json::Value& entry : bad) {
        ClearSyslog();
        EXPECT_NO_THROW(EXPECT_EQ(fix.Merge(entry), 0) << entry);
        EXPECT_TRUE(SyslogContains("custombugfix:", LOG_ERR) &&
                    SyslogContains("bad json format!", LOG_ERR))
            << entry;
    }
    EXPECT_EQ(fix.m_smallFixNumber, 5);
}

TEST_F(CustomBugFixTest, RestartDemands) {
    const std::string kWrongType = "wrong type of json format at 'restart' object",
                      kBadFormat = "bad format in 'restart'";
    // restart as JSON text, the error ("" when accepted), the services taken.
    // clang-format off
    struct Case { std::string restart, message; std::vector<std::string> services; } cases[] = {
        {R"("none")", "", {}}, {R"("reboot")", "", {}}, {R"("all_service")", "", {}},
        {R"("sometimes")", "bad value in 'restart'", {}},
        {R"({"vyx_service": [], "pkg": []})", "no data in pkg or vyx_service", {}},
        {R"({"vyx_service": ["a"]})", kBadFormat, {}},
        {R"({"vyx_service": [7, "x", "x"], "pkg": ["p", "p"]})", "", {"7", "x"}},
        {R"(["reboot"])", kWrongType, {}}};
    // clang-format on
    for (const auto& c : cases) {
        SCOPED_TRACE(c.restart);
        ClearSyslog();
        CustomBugFix fix(3);
        Json::Value entry = SmallOnly(4, J(c.restart));
        entry["flash_upgrade"] = "yes";  // not a boolean: does not read true
        const bool ok = c.message.empty();
        EXPECT_EQ(fix.Merge(entry), ok ? 1 : 0);
        EXPECT_EQ(fix.m_smallFixNumber, ok ? 4 : -1);
        EXPECT_FALSE(fix.m_blFlashUpdate);
        EXPECT_EQ(fix.m_blNeedReboot, c.restart == R"("reboot")");
        EXPECT_EQ(fix.m_blRestartAllService, c.restart == R"("all_service")");
        EXPECT_EQ(fix.m_vyxServiceRestartList, c.services);
        EXPECT_EQ(fix.m_pkgRestartList.size(), c.services.empty() ? 0u : 1u);  // no repeats
        EXPECT_TRUE(ok ? SyslogMessages().empty()
                       : SyslogContains(c.message, LOG_ERR) &&
                             SyslogContains("failed to merge 'restart' status", LOG_ERR));
    }
}

// A package of another fix number is refused in the patch-list lookup's test.
TEST_F(CustomBugFixTest, BadProjListsAreRefused) {
    // clang-format off
    struct Case { Json::Value proj; std::string message; } cases[] = {
        {J("[]"), "empty array"}, {J(R"(["smallupdate"])"), "nothing can be parsed from 'proj' array"},
        {J(R"([{"name": "webui", "url": ")" + FixDeb("webui", 5) + R"("}])"),
         "invalid debian url [" + FixDeb("webui", 5) + "]"},
        {J(R"([{"name": "webui", "url": "http://h/webui.deb"}])"),
         "failed to parse [webui.deb] to get smallfixnum [-1]"},
        {J(R"([{"name": "webui", "url": "http://h/webui_6.1-5644-s0_all.deb"}])"),
         "failed to parse [webui_6.1-5644-s0_all.deb] to get smallfixnum [0]"}};
    // clang-format on
    for (const auto& c : cases) {
        SCOPED_TRACE(c.message);
        ClearSyslog();
        CustomBugFix fix(3);
        Json::Value entry = SmallOnly(5);
        entry["proj"] = c.proj;
        EXPECT_EQ(fix.Merge(entry), 0);
        EXPECT_TRUE(SyslogContains(c.message, LOG_ERR) &&
                    SyslogContains("failed to merge 'proj'", LOG_ERR));
        EXPECT_EQ(fix.m_smallFixNumber, -1);
    }
}

}  // namespace
}  // namespace kytotest
