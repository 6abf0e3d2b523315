// The login API VELA.Auth through the real velascgi: a private system root
// holding the built description and library and a PAM service of its own
// (pam_permit or pam_deny), so both outcomes are reached without knowing a
// password. The account is the test's own user.
#include <gtest/gtest.h>

#include <json/json.h>
#include <map>
#include <pwd.h>
#include <sstream>
#include <string>
#include <unistd.h>
#include <utility>
#include <vector>

#include "platform/StateRootTest.h"
#include "vela/user.h"
#include "vela/webapiutil.h"
#include "webentry/ChildRun.h"

namespace {

struct Reply {
    std::vector<std::string> cookies;  // the Set-Cookie values
    Json::Value body;
    int Code() const { return body["success"].asBool() ? 0 : body["error"]["code"].asInt(); }
};

class Auth : public RootTest {
protected:
    void SetUp() override
    {
        const struct passwd* pw = getpwuid(geteuid());
        ASSERT_NE(nullptr, pw);
        user_ = pw->pw_name;
        const std::string staged = BuiltProgram("root/usr/vela/velaman/webapi");
        const std::string webapi = In("/usr/vela/velaman/webapi");
        ASSERT_EQ(0, system(("mkdir -p '" + webapi + "' '" + In("/etc/pam.d") + "'").c_str()));
        ASSERT_EQ(0, symlink((staged + "/auth").c_str(), (webapi + "/auth").c_str()));
        Json::Value libDef, desc;
        ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(staged + "/lib.def", libDef));
        ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(staged + "/VELA.Auth.lib", desc));
        // Only root can switch to "system"; anyone else runs it as themselves.
        if (geteuid() != 0) {
            desc["VELA.Auth"]["runAs"] = user_;
        }
        ASSERT_TRUE(VELA::WebAPIUtil::WriteJsonFileAtomic(webapi + "/lib.def", libDef, 0644));
        ASSERT_TRUE(VELA::WebAPIUtil::WriteJsonFileAtomic(webapi + "/VELA.Auth.lib", desc, 0644));
        Conf("webapi.conf", "login_max_failures=\"2\"\nsession_idle_timeout=\"600\"\nsession_lifetime=\"7200\"\n");
        Pam("pam_permit.so");
    }

    // The PAM service answers every login with `module`.
    void Pam(const char* module)
    {
        std::ofstream(In("/etc/pam.d/vela-webapi")) << "auth required " << module
                                                     << "\naccount required pam_permit.so\n";
    }

    // One call of `method`; `body` non-empty makes it a form POST. `env`
    // adds to (or replaces) the CGI variables.
    Reply Call(const std::string& method, const std::string& body, std::vector<std::string> env = {},
               const std::string& query = "")
    {
        std::map<std::string, std::string> vars = {
            {"VELA_ROOT", In("")},
            {"REMOTE_ADDR", "192.0.2.7"},
            {"HTTP_HOST", "nas.example"},
            {"QUERY_STRING", "api=VELA.Auth&version=1&method=" + method + query},
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
        std::istringstream head(out.substr(0, end));
        for (std::string line; std::getline(head, line, '\n');) {
            if (line.compare(0, 12, "Set-Cookie: ") == 0) {
                reply.cookies.push_back(line.substr(12, line.find('\r') - 12));
            }
        }
        EXPECT_TRUE(end != std::string::npos && VELA::WebAPIUtil::ParseJson(out.substr(end + 4), reply.body)) << out;
        return reply;
    }
    Reply Login(const std::string& account, std::vector<std::string> env = {})
    {
        return Call("login", "account=" + account + "&passwd=s3cret%21", std::move(env));
    }

    std::string SessionFile(const std::string& sid) const { return In("/run/vela/sessions/" + sid); }
    bool SessionExists(const std::string& sid) const
    {
        struct stat st;
        return !sid.empty() && stat(SessionFile(sid).c_str(), &st) == 0;
    }
    bool NoSessions() const { return VELA::Test::DirEntries(In("/run/vela/sessions")).empty(); }

    std::string user_;
};

TEST_F(Auth, LoginOpensASessionAndSetsTheCookie)
{
    const Reply first = Login(user_);
    ASSERT_EQ(0, first.Code()) << first.body;
    const std::string sid = first.body["data"]["sid"].asString();
    const std::string token = first.body["data"]["token"].asString();
    EXPECT_EQ(user_, first.body["data"]["account"].asString());
    EXPECT_EQ(VLIBGroupIsAdminGroupMem(user_.c_str(), 0) == 1, first.body["data"]["isAdmin"].asBool());
    EXPECT_EQ(std::vector<std::string>{"id=" + sid + "; path=/; httponly; SameSite=Strict"}, first.cookies);
    Json::Value session;
    ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(SessionFile(sid), session));
    EXPECT_EQ(user_, session["user"].asString());
    EXPECT_EQ("192.0.2.7", session["clientIP"].asString());
    EXPECT_TRUE(session["tokenProtect"].asBool());
    EXPECT_EQ(token, session["token"].asString());
    EXPECT_EQ(600, session["idleTimeout"].asInt());
    EXPECT_EQ(7200, session["lifetime"].asInt());

    // A new login with the old cookie, over HTTPS: the old session is gone,
    // the new cookie is secure.
    const Reply second = Login(user_, {"HTTP_COOKIE=lang=en; id=" + sid, "HTTPS=on"});
    ASSERT_EQ(0, second.Code()) << second.body;
    const std::string sid2 = second.body["data"]["sid"].asString();
    EXPECT_NE(sid, sid2);
    EXPECT_FALSE(SessionExists(sid));
    EXPECT_TRUE(SessionExists(sid2));
    EXPECT_EQ(std::vector<std::string>{"id=" + sid2 + "; path=/; secure; httponly; SameSite=Strict"},
              second.cookies);
}

TEST_F(Auth, WrongPasswordsAndUnknownAccountsShareOneCodeThenBlock)
{
    Pam("pam_deny.so");
    const Reply wrong = Login(user_);
    const Reply unknown = Login("no-such-user-x");
    EXPECT_EQ(400, wrong.Code()) << wrong.body;
    EXPECT_EQ(wrong.body, unknown.body);
    EXPECT_TRUE(wrong.cookies.empty());

    // Two failures from 192.0.2.7: blocked there, and PAM is not asked any
    // more, so even a service that lets everyone in changes nothing.
    Pam("pam_permit.so");
    const Reply blocked = Login(user_);
    EXPECT_EQ(407, blocked.Code()) << blocked.body;
    const int wait = blocked.body["error"]["errors"]["waitSeconds"].asInt();
    EXPECT_TRUE(wait > 0 && wait <= 15 * 60) << blocked.body;
    EXPECT_TRUE(blocked.cookies.empty());
    // The account has one failure only: from elsewhere it gets in, and that
    // clears its record.
    const Reply elsewhere = Login(user_, {"REMOTE_ADDR=198.51.100.4"});
    EXPECT_EQ(0, elsewhere.Code()) << elsewhere.body;
    EXPECT_EQ(407, Login(user_).Code());
}

TEST_F(Auth, LogoutRemovesTheSessionAndTheCookie)
{
    const std::string sid = Login(user_).body["data"]["sid"].asString();
    ASSERT_TRUE(SessionExists(sid));
    const Reply out = Call("logout", "", {"HTTP_COOKIE=id=" + sid});
    EXPECT_EQ(0, out.Code()) << out.body;
    EXPECT_FALSE(SessionExists(sid));
    EXPECT_EQ(
        std::vector<std::string>{"id=; path=/; expires=Thu, 01-Jan-1970 00:00:01 GMT; httponly; SameSite=Strict"},
        out.cookies);
    // Without a session, or with one already gone: still a success.
    EXPECT_EQ(0, Call("logout", "").Code());
    EXPECT_EQ(0, Call("logout", "", {"HTTP_COOKIE=id=" + sid}).Code());

    // The session id as the "_sid" parameter.
    const std::string sid2 = Login(user_).body["data"]["sid"].asString();
    ASSERT_TRUE(SessionExists(sid2));
    EXPECT_EQ(0, Call("logout", "", {}, "&_sid=" + sid2).Code());
    EXPECT_FALSE(SessionExists(sid2));
}

TEST_F(Auth, MalformedCredentialsAreRefusedBeforePam)
{
    // PAM lets everyone in here: each refusal comes from the checks.
    const std::string longPassword(513, 'p');
    for (const std::string& body :
         {std::string("passwd=x"), "account=" + user_, "account=" + user_ + "&passwd=",
          std::string("account=a%2Fb&passwd=x"), std::string("account=-x&passwd=x"),
          "account=" + user_ + "&passwd=a%00b", "account=" + user_ + "&passwd=a%0Ab",
          "account=" + user_ + "%01&passwd=x", "account=" + user_ + "&passwd=" + longPassword,
          "account=" + std::string(256, 'a') + "&passwd=x"}) {
        const Reply r = Call("login", body);
        EXPECT_EQ(101, r.Code()) << body << " " << r.body;
        EXPECT_TRUE(r.cookies.empty()) << body;
    }
    // A GET, even with the account alone in the query string.
    EXPECT_EQ(101, Call("login", "", {}, "&account=" + user_).Code());
    EXPECT_TRUE(NoSessions());
}

// The password, or a parameter of an encrypted form that may carry it, in
// the query string: refused with 403 before anything else, whatever the
// body holds, though PAM would let the login in.
TEST_F(Auth, PasswordInTheQueryStringIsRefused)
{
    const std::string account = "account=" + user_;
    const std::vector<std::pair<std::string, std::string>> cases = {
        {account, "&passwd=s3cret"},
        {account + "&passwd=s3cret", "&passwd=s3cret"},
        {account, "&pass%77d=s3cret"},
        {account, "&passwd"},
        {account, "&x=1&passwd=&y=2"},
        {"", "&" + account + "&passwd=s3cret"},  // a GET
        {account, "&__cIpHeRtExT=QUJD"},
        {account + "&passwd=s3cret", "&__nEkOtReHpIc=QUJD"},
    };
    for (const auto& c : cases) {
        const Reply r = Call("login", c.first, {}, c.second);
        EXPECT_EQ(403, r.Code()) << c.second << " " << r.body;
        EXPECT_TRUE(r.cookies.empty()) << c.second;
    }
    EXPECT_TRUE(NoSessions());
    // Names that only resemble it do not stop a login.
    EXPECT_EQ(0, Call("login", account + "&passwd=s3cret", {}, "&passwdx=1&xpasswd=1&a=passwd").Code());
}

// The run-as name of the superuser is no login name: refused as a wrong
// password even by a PAM service that lets everyone in, and counted.
TEST_F(Auth, SystemIsNoLoginName)
{
    const Reply r = Login("system");
    EXPECT_EQ(400, r.Code()) << r.body;
    EXPECT_TRUE(r.cookies.empty());
    EXPECT_TRUE(NoSessions());
    Login("system");
    EXPECT_EQ(407, Login(user_).Code()) << "two refusals from 192.0.2.7 reach login_max_failures";
}

TEST_F(Auth, KeyAnswersThePublicKey)
{
    const Reply r = Call("key", "");
    ASSERT_EQ(0, r.Code()) << r.body;
    const std::string pem = r.body["data"]["publicKey"].asString();
    EXPECT_EQ(0u, pem.find("-----BEGIN PUBLIC KEY-----\n")) << pem;
    EXPECT_EQ(r.body, Call("key", "").body) << "the key pair is made once";
}

}  // namespace
