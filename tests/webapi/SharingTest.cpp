// The sharing-link API VELA.Sharing through the real velascgi, in a private
// system root whose data volume holds a folder for everyone and one only
// root may read. Owners are "nobody" (an ordinary account) and root (an
// administrator), with login sessions made in the store; visitors have none.
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
#include "vela/session.h"
#include "vela/sharing.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"
#include "webentry/ChildRun.h"

namespace {

namespace sdb = VELA::sharing::db;

struct Reply {
    std::vector<std::string> cookies;
    Json::Value body;
    int Code() const { return body["success"].asBool() ? 0 : body["error"]["code"].asInt(); }
    const Json::Value& Data() const { return body["data"]; }
};

long long g_fakeNow = 0;
long long FakeClock() { return g_fakeNow; }

class SharingAPI : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the owner's identity is taken by switching to it, which needs root";
        }
        const std::string root = root_.Path();
        ASSERT_EQ(0, chmod(root.c_str(), 0755));  // searchable like "/"
        const std::string staged = BuiltProgram("root/usr/vela/velaman/webapi");
        const std::string webapi = root + "/usr/vela/velaman/webapi";
        ASSERT_EQ(0, system(("mkdir -p '" + webapi + "' '" + root + "/etc/vela' '" + root + "/volume1/share' '" +
                             root + "/volume1/private' '" + root + "/outside'")
                                .c_str()));
        ASSERT_EQ(0, symlink((staged + "/sharing").c_str(), (webapi + "/sharing").c_str()));
        for (const char* name : {"lib.def", "VELA.Sharing.lib"}) {
            ASSERT_EQ(0, symlink((staged + "/" + name).c_str(), (webapi + "/" + name).c_str()));
        }
        ASSERT_EQ(0, chmod((root + "/volume1/private").c_str(), 0700));
        Write("/etc/vela/volumes.conf", "/volume1\n");
        Write("/etc/vela/webapi.conf", "login_max_failures=\"3\"\n");
        Write("/volume1/share/doc.txt", "shared\n");
        Write("/volume1/private/secret.txt", "root only\n");
        Write("/outside/x.txt", "x\n");
        nobody_ = NewSession("nobody");
        daemon_ = NewSession("daemon");
        admin_ = NewSession("root");
    }

    void Write(const std::string& path, const std::string& text)
    {
        std::ofstream(root_.Path() + path) << text;
        chmod((root_.Path() + path).c_str(), 0644);
    }

    std::string NewSession(const char* user)
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", root_.Path().c_str());
        VELA::System::RootReset();
        std::string sid, token;
        VELA::Session::Options options;
        EXPECT_EQ(0, VELA::Session::Create(user, nullptr, &options, sid, token));
        VELA::System::RootReset();
        return sid;
    }

    // One call; a non-empty body makes it a form POST. `env` adds CGI variables.
    Reply Call(const std::string& api, const std::string& method, const std::string& body,
               const std::vector<std::string>& env = {}, const std::string& query = "")
    {
        std::map<std::string, std::string> vars = {
            {"VELA_ROOT", root_.Path()},
            {"REMOTE_ADDR", "192.0.2.7"},
            {"HTTP_HOST", "nas.example"},
            {"QUERY_STRING", "api=" + api + "&version=1&method=" + method + query},
            {"REQUEST_METHOD", body.empty() ? "GET" : "POST"},
            {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
            {"CONTENT_LENGTH", std::to_string(body.size())},
        };
        for (const std::string& e : env) {
            vars[e.substr(0, e.find('='))] = e.substr(e.find('=') + 1);
        }
        std::vector<std::string> list;
        for (const auto& v : vars) {
            list.push_back(v.first + "=" + v.second);
        }
        const std::string out = RunWithEnv(BuiltProgram("velascgi"), list, body);
        Reply reply;
        const size_t end = out.find("\r\n\r\n");
        EXPECT_NE(std::string::npos, end) << out;
        if (end == std::string::npos) {
            return reply;
        }
        for (size_t pos = 0; pos < end;) {
            const size_t eol = out.find("\r\n", pos);
            const std::string line = out.substr(pos, eol - pos);
            if (line.compare(0, 12, "Set-Cookie: ") == 0) {
                reply.cookies.push_back(line.substr(12));
            }
            pos = eol + 2;
        }
        EXPECT_TRUE(VELA::WebAPIUtil::ParseJson(out.substr(end + 4), reply.body)) << out;
        return reply;
    }
    Reply Owner(const std::string& sid, const std::string& method, const std::string& body,
                const std::string& query = "")
    {
        return Call("VELA.Sharing", method, body, {"HTTP_COOKIE=id=" + sid}, query);
    }
    Reply Open(const std::string& body, const std::vector<std::string>& env = {})
    {
        return Call("VELA.Sharing.Visitor", "open", body, env);
    }
    std::string CreateLink(const std::string& extra)
    {
        const Reply r = Owner(nobody_, "create", "project=vela.docs&path=/volume1/share/doc.txt" + extra);
        EXPECT_EQ(0, r.Code()) << r.body;
        return r.Data()["id"].asString();
    }

    VELA::Test::TempDir root_;
    std::string nobody_, daemon_, admin_;
};

TEST_F(SharingAPI, OwnersCreateListUpdateAndRevokeTheirLinks)
{
    const Reply made =
        Owner(nobody_, "create", "project=vela.docs&path=/volume1/share/doc.txt&password=pw&uses=5&expires=600");
    ASSERT_EQ(0, made.Code()) << made.body;
    const Json::Value& link = made.Data();
    const std::string id = link["id"].asString();
    EXPECT_EQ("http://nas.example/sharing/vela.docs/" + id, link["url"].asString());
    EXPECT_EQ("/volume1/share/doc.txt", link["path"].asString());
    EXPECT_EQ("doc.txt", link["name"].asString());
    EXPECT_EQ("nobody", link["owner"].asString());
    EXPECT_TRUE(link["hasPassword"].asBool());
    EXPECT_EQ(5, link["useLimit"].asInt());
    // Counted from the handler's clock; the store stamps "created" a moment
    // later, which may be the next second.
    const long long lifetime = link["expires"].asInt64() - link["created"].asInt64();
    EXPECT_TRUE(lifetime == 600 || lifetime == 599) << link;
    // Nothing but these members: no password hash.
    const std::set<std::string> members = {"id", "project", "path", "name", "owner", "created", "expires",
                                           "hasPassword", "useLimit", "useCount", "matchIP", "revoked",
                                           "expired", "url"};
    const auto names = link.getMemberNames();
    EXPECT_EQ(members, std::set<std::string>(names.begin(), names.end()));
    const std::string daemonLink = Call("VELA.Sharing", "create", "project=p&path=/volume1/share",
                                        {"HTTP_COOKIE=id=" + daemon_})
                                       .Data()["id"]
                                       .asString();
    ASSERT_FALSE(daemonLink.empty());

    // Each owner lists its own; only an administrator lists all.
    const Reply own = Owner(nobody_, "list", "");
    ASSERT_EQ(1, own.Data()["total"].asInt()) << own.body;
    EXPECT_EQ(id, own.Data()["links"][0]["id"].asString());
    EXPECT_EQ(105, Owner(nobody_, "list", "all=true").Code());
    EXPECT_EQ(2, Owner(admin_, "list", "all=true").Data()["total"].asInt());

    // Another owner's link is answered like an unknown one.
    EXPECT_EQ(460, Owner(daemon_, "revoke", "id=" + id).Code());
    EXPECT_EQ(460, Owner(daemon_, "update", "id=" + id + "&uses=1").Code());
    EXPECT_EQ(460, Owner(nobody_, "revoke", "id=AAAAAAAAAAAAAAAAAAAAAA").Code());
    EXPECT_EQ(101, Owner(nobody_, "revoke", "id=../x").Code());
    EXPECT_EQ(101, Owner(nobody_, "update", "id=" + id).Code());  // nothing to change

    const Reply updated = Owner(nobody_, "update", "id=" + id + "&uses=9&password=&matchIP=true");
    ASSERT_EQ(0, updated.Code()) << updated.body;
    EXPECT_EQ(9, updated.Data()["useLimit"].asInt());
    EXPECT_FALSE(updated.Data()["hasPassword"].asBool());
    EXPECT_TRUE(updated.Data()["matchIP"].asBool());

    // An administrator revokes anyone's link; a revoked one cannot change.
    EXPECT_EQ(0, Owner(admin_, "revoke", "id=" + id).Code());
    EXPECT_TRUE(Owner(nobody_, "list", "").Data()["links"][0]["revoked"].asBool());
    EXPECT_EQ(461, Owner(nobody_, "update", "id=" + id + "&uses=1").Code());
}

TEST_F(SharingAPI, CreateRefusesWhatTheOwnerMayNotShare)
{
    const std::string base = "project=p&path=";
    EXPECT_EQ(462, Owner(nobody_, "create", base + "/outside/x.txt").Code());
    EXPECT_EQ(462, Owner(nobody_, "create", base + "/volume1/share/none").Code());
    EXPECT_EQ(462, Owner(nobody_, "create", base + "/volume1").Code());
    // A link out of the volume is followed before the check.
    ASSERT_EQ(0, symlink("../../outside", (root_.Path() + "/volume1/share/out").c_str()));
    EXPECT_EQ(462, Owner(nobody_, "create", base + "/volume1/share/out/x.txt").Code());
    // Only root reads the folder: refused for nobody, granted to root.
    EXPECT_EQ(463, Owner(nobody_, "create", base + "/volume1/private/secret.txt").Code());
    EXPECT_EQ(0, Owner(admin_, "create", base + "/volume1/private/secret.txt").Code());
    for (const std::string& body : std::vector<std::string>{
             base + "/volume1/share/../share/doc.txt", base + "volume1/share", std::string("path=/volume1/share"),
          "project=../p&path=/volume1/share", base + "/volume1/share%0A", base + "/volume1/share&uses=-1",
          base + "/volume1/share&expires=1x", base + "/volume1/share&matchIP=yes"}) {
        EXPECT_EQ(101, Owner(nobody_, "create", body).Code()) << body;
    }
    EXPECT_EQ(465, Owner(nobody_, "create", base + "/volume1/share", "&password=x").Code());
    EXPECT_EQ(119, Call("VELA.Sharing", "create", base + "/volume1/share").Code());  // no login

    // The bound of live links per owner (filled in the store directly).
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", root_.Path().c_str());
        VELA::System::RootReset();
        sdb::EntryDB entries(sdb::SharingDB::Instance());
        sdb::LinkSpec link;
        link.projectName = "p";
        link.path = "/volume1/share";
        link.uid = 1;
        link.userName = "daemon";
        VELA::sharing::record::Entry e;
        for (int i = 0; i < 200; ++i) {
            ASSERT_TRUE(entries.Create(link, e));
        }
        VELA::System::RootReset();
    }
    EXPECT_EQ(464, Call("VELA.Sharing", "create", base + "/volume1/share", {"HTTP_COOKIE=id=" + daemon_}).Code());
}

TEST_F(SharingAPI, VisitorsOpenLinksWithTheirPassword)
{
    const std::string id = CreateLink("&password=open%20sesame");
    EXPECT_EQ(473, Open("link=" + id).Code());
    const Reply wrong = Open("link=" + id + "&password=guess");
    EXPECT_EQ(473, wrong.Code());
    EXPECT_TRUE(wrong.cookies.empty());
    EXPECT_EQ(465, Call("VELA.Sharing.Visitor", "open", "link=" + id, {}, "&password=open%20sesame").Code());

    const Reply ok = Open("link=" + id + "&password=open%20sesame", {"HTTPS=on"});
    ASSERT_EQ(0, ok.Code()) << ok.body;
    ASSERT_EQ(1u, ok.cookies.size());
    const std::string cookie = ok.cookies[0];
    const std::string sid = cookie.substr(12, cookie.find(';') - 12);
    EXPECT_EQ("sharing_sid=" + sid + "; path=/; secure; httponly; SameSite=Strict", cookie);
    EXPECT_EQ("vela.docs", ok.Data()["project"].asString());
    EXPECT_EQ("doc.txt", ok.Data()["name"].asString());
    EXPECT_EQ("https://nas.example/sharing/vela.docs/" + id, ok.Data()["url"].asString());
    EXPECT_FALSE(ok.Data().isMember("path"));
    // The held session is kept: no new cookie, no use spent.
    const Reply again = Open("link=" + id, {"HTTP_COOKIE=sharing_sid=" + sid});
    EXPECT_EQ(0, again.Code()) << again.body;
    EXPECT_TRUE(again.cookies.empty());
    EXPECT_EQ(1, Owner(nobody_, "list", "").Data()["links"][0]["useCount"].asInt());

    // Three wrong passwords block the address, even for the right one;
    // another address still gets in.
    for (const char* guess : {"a", "b", "c"}) {
        EXPECT_EQ(473, Open("link=" + id + "&password=" + guess).Code());
    }
    EXPECT_EQ(474, Open("link=" + id + "&password=open%20sesame").Code());
    EXPECT_EQ(0, Open("link=" + id + "&password=open%20sesame", {"REMOTE_ADDR=198.51.100.4"}).Code());

    // Revoking ends the held session at once; revoked and unknown links
    // answer alike.
    ASSERT_EQ(0, Owner(nobody_, "revoke", "id=" + id).Code());
    const Reply gone = Open("link=" + id, {"HTTP_COOKIE=sharing_sid=" + sid});
    EXPECT_EQ(470, gone.Code());
    EXPECT_EQ(Open("link=AAAAAAAAAAAAAAAAAAAAAA").body, gone.body);
    EXPECT_EQ(101, Open("link=" + id + "x").Code());
}

TEST_F(SharingAPI, ExpiredAndUsedUpLinksAreRefused)
{
    const std::string once = CreateLink("&uses=1");
    EXPECT_EQ(0, Open("link=" + once).Code());
    EXPECT_EQ(472, Open("link=" + once).Code());

    // A link made "a minute ago" that expired half a minute later.
    std::string expired;
    {
        VELA::Test::ScopedEnv env("VELA_ROOT", root_.Path().c_str());
        VELA::System::RootReset();
        const long long now = static_cast<long long>(time(nullptr));
        g_fakeNow = now - 60;
        VELA::Session::SetClockForTest(FakeClock);
        sdb::LinkSpec link;
        link.projectName = "p";
        link.path = "/volume1/share/doc.txt";
        link.uid = 65534;
        link.userName = "nobody";
        link.expireTime = now - 30;
        VELA::sharing::record::Entry e;
        EXPECT_TRUE(sdb::EntryDB(sdb::SharingDB::Instance()).Create(link, e));
        VELA::Session::SetClockForTest(nullptr);
        VELA::System::RootReset();
        expired = e.get_hash();
    }
    EXPECT_EQ(471, Open("link=" + expired).Code());
    for (const Json::Value& link : Owner(nobody_, "list", "").Data()["links"]) {
        EXPECT_EQ(link["id"].asString() == expired, link["expired"].asBool()) << link;
    }
}

}  // namespace
