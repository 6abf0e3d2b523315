// The operators' API VELA.Admin through the real velascgi, in a private
// system root that serves only its description: an administrator (root)
// and an ordinary user (nobody) with login sessions made in the store; the
// usage counter's files, task records and login-guard records written
// there beforehand.
#include <gtest/gtest.h>

#include <fstream>
#include <json/json.h>
#include <map>
#include <set>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "support/TestSupport.h"
#include "vela/loginguard.h"
#include "vela/session.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webentry/ChildRun.h"

namespace {

struct Reply {
    Json::Value body;
    std::string text;
    int Code() const { return body["success"].asBool() ? 0 : body["error"]["code"].asInt(); }
    const Json::Value& Data() const { return body["data"]; }
};

class AdminAPI : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the methods switch identity, which needs root";
        }
        const std::string root = root_.Path();
        ASSERT_EQ(0, chmod(root.c_str(), 0755));  // searchable like "/"
        const std::string staged = BuiltProgram("root/usr/vela/velaman/webapi");
        const std::string webapi = root + "/usr/vela/velaman/webapi";
        ASSERT_EQ(0, system(("mkdir -p '" + webapi + "' '" + root + "/etc/vela' '" + root + "/var/spool/webapi'").c_str()));
        ASSERT_EQ(0, symlink((staged + "/admin").c_str(), (webapi + "/admin").c_str()));
        for (const char* name : {"lib.def", "VELA.Admin.lib"}) {
            ASSERT_EQ(0, symlink((staged + "/" + name).c_str(), (webapi + "/" + name).c_str()));
        }
        admin_ = NewSession("root", admin_token_);
        user_ = NewSession("nobody", user_token_);
    }

    void Write(const std::string& path, const std::string& text)
    {
        std::ofstream(root_.Path() + path) << text;
    }

    // Runs `f` with the test's root as the system root.
    template <typename F>
    void InRoot(F f)
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", root_.Path().c_str());
        VELA::System::RootReset();
        f();
        VELA::System::RootReset();
    }

    std::string NewSession(const char* user, std::string& token)
    {
        std::string sid;
        InRoot([&] {
            VELA::Session::Options options;
            EXPECT_EQ(0, VELA::Session::Create(user, nullptr, &options, sid, token));
        });
        return sid;
    }

    // One call of VELA.Admin with the session `sid`; `query` adds to the
    // query string.
    Reply Call(const std::string& sid, const std::string& method, const std::string& query = "")
    {
        const std::vector<std::string> env = {
            "VELA_ROOT=" + root_.Path(),
            "REMOTE_ADDR=192.0.2.7",
            "HTTP_HOST=nas.example",
            "HTTP_COOKIE=id=" + sid,
            "QUERY_STRING=api=VELA.Admin&version=1&method=" + method + query,
            "REQUEST_METHOD=GET",
        };
        const std::string out = RunWithEnv(BuiltProgram("velascgi"), env, "");
        Reply reply;
        const size_t end = out.find("\r\n\r\n");
        EXPECT_NE(std::string::npos, end) << out;
        if (end != std::string::npos) {
            reply.text = out.substr(end + 4);
            EXPECT_TRUE(VELA::WebAPIUtil::ParseJson(reply.text, reply.body)) << out;
        }
        return reply;
    }

    // The methods of VELA.Admin version 1 in an answer of "apis".
    static Json::Value AdminMethods(const Reply& r)
    {
        for (const Json::Value& api : r.Data()["apis"]) {
            if (api["api"] == "VELA.Admin") {
                return api["methods"]["1"];
            }
        }
        return Json::Value();
    }

    VELA::Test::TempDir root_;
    std::string admin_, admin_token_;
    std::string user_, user_token_;
};

TEST_F(AdminAPI, ApisAnswersWhatTheCallerMayCallAndTheRestIsForAdministrators)
{
    const Reply admin = Call(admin_, "apis");
    ASSERT_EQ(0, admin.Code()) << admin.text;
    ASSERT_EQ(1u, admin.Data()["apis"].size()) << "only VELA.Admin is described here";
    EXPECT_EQ(1, admin.Data()["apis"][0]["minVersion"].asInt());
    EXPECT_EQ(1, admin.Data()["apis"][0]["maxVersion"].asInt());
    Json::Value all(Json::arrayValue);
    for (const char* m : {"apis", "blocked", "revoke", "sessions", "tasks", "usage"}) {
        all.append(m);
    }
    EXPECT_EQ(all, AdminMethods(admin));

    const Reply user = Call(user_, "apis");
    ASSERT_EQ(0, user.Code()) << user.text;
    Json::Value own(Json::arrayValue);
    own.append("apis");
    EXPECT_EQ(own, AdminMethods(user));
    for (const char* m : {"usage", "tasks", "sessions", "revoke", "blocked"}) {
        EXPECT_EQ(105, Call(user_, m).Code()) << m;
    }
    EXPECT_EQ(119, Call("", "apis").Code()) << "no session";
}

TEST_F(AdminAPI, SessionsShowHandlesNeverCredentialsAndRevokeEndsOne)
{
    const Reply list = Call(admin_, "sessions");
    ASSERT_EQ(0, list.Code()) << list.text;
    for (const std::string& secret : {admin_, admin_token_, user_, user_token_}) {
        EXPECT_EQ(std::string::npos, list.text.find(secret)) << "a session id or token in the answer";
    }
    std::map<std::string, Json::Value> byUser;
    for (const Json::Value& s : list.Data()["sessions"]) {
        byUser[s["user"].asString()] = s;
    }
    ASSERT_EQ(2u, byUser.size()) << list.text;
    EXPECT_TRUE(byUser["root"]["current"].asBool());
    EXPECT_FALSE(byUser["nobody"]["current"].asBool());
    std::string handle;
    InRoot([&] { EXPECT_EQ(0, VELA::Session::HandleOf(user_.c_str(), handle)); });
    EXPECT_EQ(handle, byUser["nobody"]["id"].asString());
    EXPECT_TRUE(VELA::Session::IsHandle(handle.c_str()));
    EXPECT_GT(byUser["nobody"]["created"].asInt64(), 0);
    EXPECT_GE(byUser["nobody"]["lastUsed"].asInt64(), byUser["nobody"]["created"].asInt64());
    EXPECT_EQ("", byUser["nobody"]["address"].asString()) << "a session bound to no address";

    // Bad handles are malformed calls; an unknown one is the API's own error.
    std::string upper = handle;
    for (char& c : upper) {
        c = static_cast<char>(toupper(c));
    }
    for (const std::string& bad : {std::string(""), std::string("&id="), "&id=" + handle + "0", "&id=" + upper,
                                   "&id=" + user_, std::string("&id=../../x"), "&id=[\"" + handle + "\"]"}) {
        EXPECT_EQ(101, Call(admin_, "revoke", bad).Code()) << bad;
    }
    EXPECT_EQ(480, Call(admin_, "revoke", "&id=0123456789abcdef").Code());

    EXPECT_EQ(0, Call(user_, "apis").Code());
    const Reply revoked = Call(admin_, "revoke", "&id=" + handle);
    ASSERT_EQ(0, revoked.Code()) << revoked.text;
    EXPECT_TRUE(revoked.Data()["revoked"].asBool());
    EXPECT_EQ(105, Call(user_, "apis").Code()) << "the session is gone";
    EXPECT_EQ(480, Call(admin_, "revoke", "&id=" + handle).Code());
    EXPECT_EQ(1u, Call(admin_, "sessions").Data()["sessions"].size());
}

// The counter's files are hostile input: what is not a count is skipped,
// what is too large or not a plain file is not read.
TEST_F(AdminAPI, UsageReadsTheCounterFilesSortedByCount)
{
    Write("/var/spool/webapi/VELA.Sample.json",
          R"({"VELA.Sample_1_echo": {"count": 12, "ctime": 1700000000},
              "VELA.Sample_2_typed": {"count": 3},
              "VELA.Sample_1_get_all": {"count": 40},
              "VELA.Sample_1_neg": {"count": -1},
              "VELA.Sample_1_text": {"count": "9"},
              "VELA.Sample_x_bad": {"count": 1},
              "VELA.Sample_1_": {"count": 1},
              "../etc_1_x": {"count": 1},
              "VELA.Sample_1_flat": 5})");
    Write("/var/spool/webapi/My_API.Tool.json", R"({"My_API.Tool_3_run": {"count": 12}})");
    Write("/var/spool/webapi/broken.json", "{\"VELA.X_1_y\": {\"count\": 7}");
    Write("/var/spool/webapi/huge.json",
          "{\"VELA.Huge_1_y\": {\"count\": 99}, \"pad\": \"" + std::string(1024 * 1024, 'x') + "\"}");
    Write("/var/spool/webapi/.hidden.json", R"({"VELA.Hidden_1_y": {"count": 99}})");
    Write("/var/spool/webapi/notes.txt", R"({"VELA.Txt_1_y": {"count": 99}})");
    Write("/elsewhere.json", R"({"VELA.Link_1_y": {"count": 99}})");
    ASSERT_EQ(0, symlink((root_.Path() + "/elsewhere.json").c_str(),
                         (root_.Path() + "/var/spool/webapi/link.json").c_str()));

    const Reply r = Call(admin_, "usage");
    ASSERT_EQ(0, r.Code()) << r.text;
    EXPECT_FALSE(r.Data()["enabled"].asBool());
    std::string got;
    for (const Json::Value& c : r.Data()["counts"]) {
        got += c["api"].asString() + " " + std::to_string(c["version"].asInt()) + " " + c["method"].asString() +
               " " + std::to_string(c["count"].asInt64()) + "; ";
    }
    EXPECT_EQ("VELA.Sample 1 get_all 40; My_API.Tool 3 run 12; VELA.Sample 1 echo 12; VELA.Sample 2 typed 3; ",
              got);

    Write("/etc/velainfo.conf", "enable_data_collect=\"yes\"\n");
    EXPECT_TRUE(Call(admin_, "usage").Data()["enabled"].asBool());
}

TEST_F(AdminAPI, TasksListEveryOwnersRecordsWithTheirState)
{
    const std::string tasks = root_.Path() + "/var/lib/vela/tasks";
    ASSERT_EQ(0, system(("mkdir -p '" + tasks + "/alice' '" + tasks + "/@administrators'").c_str()));
    Write("/var/lib/vela/tasks/alice/sum-1",
          R"({"version":1,"owner":"alice","id":"sum-1","created":1700000000,"updated":1700000000,"finished":false,
              "finished_at":0,"create_pid":999999999,"create_start":1,
              "properties":{"info":{"api":"VELA.Sample","method":"checksum"},"progress":{"percent":140}}})");
    Write("/var/lib/vela/tasks/@administrators/sum-2",
          R"({"version":1,"owner":"@administrators","id":"sum-2","created":1700000100,"updated":1700000100,
              "finished":true,"finished_at":1700000200,"create_pid":0,"create_start":-1,"properties":{}})");
    const Reply r = Call(admin_, "tasks");
    ASSERT_EQ(0, r.Code()) << r.text;
    std::map<std::string, Json::Value> byId;
    for (const Json::Value& t : r.Data()["tasks"]) {
        byId[t["id"].asString()] = t;
    }
    ASSERT_EQ(2u, byId.size()) << r.text;
    const Json::Value& lost = byId["alice/sum-1"];
    EXPECT_EQ("alice", lost["owner"].asString());
    EXPECT_EQ("VELA.Sample", lost["api"].asString());
    EXPECT_EQ("checksum", lost["method"].asString());
    EXPECT_EQ("lost", lost["state"].asString()) << "its worker is gone";
    EXPECT_EQ(100, lost["progress"].asInt());
    EXPECT_EQ(1700000000, lost["created"].asInt64());
    const Json::Value& done = byId["@administrators/sum-2"];
    EXPECT_EQ("finished", done["state"].asString());
    EXPECT_TRUE(done["progress"].isNull());
    EXPECT_TRUE(done["api"].isNull());
}

TEST_F(AdminAPI, BlockedListsTheLoginGuardsBlocks)
{
    const Reply none = Call(admin_, "blocked");
    ASSERT_EQ(0, none.Code()) << none.text;
    EXPECT_EQ(0u, none.Data()["addresses"].size());
    EXPECT_EQ(0u, none.Data()["accounts"].size());

    const long long before = time(nullptr);
    InRoot([] {
        VELA::Session::LoginSettings settings;
        for (int i = 0; i < VELA_LOGIN_MAX_FAILURES_DEFAULT; ++i) {
            ASSERT_EQ(VELA_LOGIN_GUARD_ALLOW, VELA::Session::LoginGuardBegin(&settings, "daemon", "198.51.100.4", nullptr));
            VELA::Session::LoginGuardFailed(&settings, "daemon", "198.51.100.4", "test");
        }
    });
    const Reply r = Call(admin_, "blocked");
    ASSERT_EQ(0, r.Code()) << r.text;
    ASSERT_EQ(1u, r.Data()["addresses"].size()) << r.text;
    const Json::Value& a = r.Data()["addresses"][0];
    EXPECT_EQ("198.51.100.4", a["address"].asString());
    EXPECT_EQ(VELA_LOGIN_MAX_FAILURES_DEFAULT, a["failures"].asInt());
    EXPECT_GE(a["until"].asInt64(), before + VELA_LOGIN_BLOCK_DEFAULT * 60);
    ASSERT_EQ(1u, r.Data()["accounts"].size()) << "the account's count reached the limit too";
    EXPECT_EQ("daemon", r.Data()["accounts"][0]["account"].asString());
}

}  // namespace
