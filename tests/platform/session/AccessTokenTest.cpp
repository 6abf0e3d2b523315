// Access tokens against real files under a temporary VELA_ROOT: grants,
// patterns, expiry, users that went away, hostile tokens, corrupt files,
// listing and revocation.

#include "platform/PlatformTest.h"
#include "vela/token.h"
#include "vela/webapiutil.h"

namespace {

using namespace VELA::Test;

class AccessTokenTest : public StateRootTest {
protected:
    std::string Dir() const { return In("/var/lib/vela/tokens"); }
    std::string File(const std::string& id) const { return Dir() + "/" + id; }

    std::string Create(const std::vector<std::string>& apis, const std::vector<std::string>& methods,
                       long long lifetime = 0, const char* user = "root", std::string* id = nullptr)
    {
        std::string token, tid;
        EXPECT_EQ(0, VelaAccessTokenCreate(user, apis, methods, lifetime, token, tid));
        EXPECT_EQ(static_cast<size_t>(VELA_TOKEN_LEN), token.size());
        EXPECT_EQ(tid, token.substr(0, VELA_TOKEN_ID_LEN));
        if (id != nullptr) {
            *id = tid;
        }
        return token;
    }

    int Grant(const std::string& token, const char* api, const char* method)
    {
        user_[0] = 'x';
        user_[1] = '\0';
        return VelaAccessTokenGrant(token.c_str(), api, method, user_, sizeof(user_));
    }

    LogCapture log_;
    char user_[493];
};

TEST_F(AccessTokenTest, CreateWritesPrivateFile)
{
    std::string id;
    const std::string token = Create({"VELA.Demo.*"}, {"get*", "list"}, 3600, "root", &id);
    EXPECT_EQ('.', token[VELA_TOKEN_ID_LEN]);
    EXPECT_EQ(0700u, Mode(Dir()));
    EXPECT_EQ(0600u, Mode(File(id)));

    Json::Value doc;
    ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(File(id), doc));
    ExpectMembers(doc, {{"user", "root"}, {"secret", token.substr(VELA_TOKEN_ID_LEN + 1)},
                        {"expires", Json::Int64(kStart + 3600)}});
    EXPECT_EQ(2u, doc["methods"].size());

    std::string other;
    Create({"*"}, {"*"}, 0, "root", &other);
    EXPECT_NE(id, other);
    ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(File(other), doc));
    EXPECT_EQ(kStart + VELA_TOKEN_LIFETIME_DEFAULT, doc["expires"].asInt64());
}

TEST_F(AccessTokenTest, PatternsSelectApiAndMethod)
{
    const std::string token = Create({"VELA.Demo.*", "VELA.Exact"}, {"get*", "list"});
    const struct { const char* api; const char* method; int rc; } cases[] = {
        {"VELA.Demo.Test", "get", 0}, {"VELA.Demo.Test", "getInfo", 0}, {"VELA.Exact", "list", 0},
        {"VELA.Demo", "get", -3},  // the prefix includes the "."
        {"VELA.Exact2", "get", -3}, {"VELA.Other.Test", "get", -3}, {"vela.demo.test", "get", -3},  // case-sensitive
        {"VELA.Demo.Test", "set", -3}, {"VELA.Demo.Test", "Get", -3}, {"VELA.Demo.Test", "listAll", -3},
        {"", "get", -3}, {"VELA.Demo.../x", "get", -3}, {"VELA.Demo.Test", nullptr, -3},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(c.rc, Grant(token, c.api, c.method)) << c.api << " " << (c.method ? c.method : "null");
        EXPECT_STREQ(c.rc == 0 ? "root" : "", user_) << c.api;
    }
    EXPECT_EQ(-3, Grant(token, std::string(200, 'V').c_str(), "get"));

    const std::string all = Create({"*"}, {"*"});
    EXPECT_EQ(0, Grant(all, "Anything.At.All", "whatever"));
}

TEST_F(AccessTokenTest, Expiry)
{
    const std::string token = Create({"*"}, {"*"}, 100);
    Now() += 99;
    EXPECT_EQ(0, Grant(token, "VELA.Demo", "get"));
    Now() += 1;
    EXPECT_EQ(-2, Grant(token, "VELA.Demo", "get"));
    EXPECT_STREQ("", user_);
    EXPECT_TRUE(log_.Contains("expired"));

    // An expired token is removed by the next creation.
    std::vector<VelaAccessTokenRecord> list;
    ASSERT_EQ(0, VelaAccessTokenList(list));
    ASSERT_EQ(1u, list.size());
    EXPECT_TRUE(list[0].expired);
    Create({"*"}, {"*"});
    ASSERT_EQ(0, VelaAccessTokenList(list));
    ASSERT_EQ(1u, list.size());
    EXPECT_FALSE(list[0].expired);
    EXPECT_EQ(-1, Grant(token, "VELA.Demo", "get"));
}

TEST_F(AccessTokenTest, UserMustStillExistAndFitTheBuffer)
{
    std::string id;
    const std::string token = Create({"*"}, {"*"}, 0, "nobody", &id);
    EXPECT_EQ(0, Grant(token, "VELA.Demo", "get"));
    EXPECT_STREQ("nobody", user_);
    EditJson(File(id), "user", "vela-no-such-user");  // the user was deleted
    EXPECT_EQ(-4, Grant(token, "VELA.Demo", "get"));
    EXPECT_STREQ("", user_);

    std::string tok = "stale", tid = "stale";
    EXPECT_EQ(-1, VelaAccessTokenCreate("vela-no-such-user", {"*"}, {"*"}, 0, tok, tid));
    EXPECT_TRUE(tok.empty() && tid.empty());
    EXPECT_TRUE(log_.Contains("no user \"vela-no-such-user\""));

    // The user name must fit the caller's buffer.
    const std::string all = Create({"*"}, {"*"});
    char small[4] = "xx";
    EXPECT_EQ(-5, VelaAccessTokenGrant(all.c_str(), "VELA.Demo", "get", small, sizeof(small)));
    EXPECT_STREQ("", small);
    EXPECT_EQ(-5, VelaAccessTokenGrant(all.c_str(), "VELA.Demo", "get", nullptr, 493));
    char exact[5];
    EXPECT_EQ(0, VelaAccessTokenGrant(all.c_str(), "VELA.Demo", "get", exact, sizeof(exact)));
    EXPECT_STREQ("root", exact);
}

TEST_F(AccessTokenTest, CreateRefusesBadInput)
{
    std::string token, id;
    for (const char* bad : {"", "a*b", "*x", "**", "a b", "../x", "VELA/Demo", "a\n"}) {
        EXPECT_EQ(-1, VelaAccessTokenCreate("root", {bad}, {"get"}, 0, token, id)) << bad;
        EXPECT_EQ(-1, VelaAccessTokenCreate("root", {"VELA.Demo"}, {bad}, 0, token, id)) << bad;
        EXPECT_FALSE(VelaAccessTokenIsPattern(bad)) << bad;
    }
    const struct { const char* user; std::vector<std::string> apis, methods; long long lifetime; } bad[] = {
        {"root", {}, {"get"}, 0}, {"root", {"VELA.Demo"}, {}, 0}, {"root", {std::string(129, 'a')}, {"get"}, 0},
        {"root", std::vector<std::string>(33, "a"), {"get"}, 0}, {"root", {"*"}, {"*"}, -1},
        {"root", {"*"}, {"*"}, VELA_TOKEN_LIFETIME_MAX + 1}, {nullptr, {"*"}, {"*"}, 0}, {"a/b", {"*"}, {"*"}, 0}};
    for (size_t i = 0; i < sizeof(bad) / sizeof(bad[0]); ++i) {
        EXPECT_EQ(-1, VelaAccessTokenCreate(bad[i].user, bad[i].apis, bad[i].methods, bad[i].lifetime, token, id)) << i;
    }
    EXPECT_TRUE(token.empty());
    EXPECT_TRUE(DirEntries(Dir()).empty());
}

TEST_F(AccessTokenTest, HostileTokensTouchNothing)
{
    std::string id;
    const std::string token = Create({"*"}, {"*"}, 0, "root", &id);
    std::ofstream(root_.Path() + "/x") << "outside";
    const auto before = Tree(root_.Path());

    std::string wrongSecret = token;
    wrongSecret.back() = wrongSecret.back() == 'A' ? 'B' : 'A';
    std::string traversal = "../../../../../../../x." + token.substr(VELA_TOKEN_ID_LEN + 1);
    traversal.resize(VELA_TOKEN_LEN, 'a');
    std::string nul = token;
    nul[30] = '\0';
    const std::vector<std::string> hostile = {
        "", ".", "..", "../x", "/etc/passwd", id, id + ".", token + "A", token.substr(0, VELA_TOKEN_LEN - 1),
        std::string(10000, 'A'), std::string(VELA_TOKEN_LEN, '\xff'), traversal, wrongSecret,
        token.substr(0, VELA_TOKEN_ID_LEN) + "/" + token.substr(VELA_TOKEN_ID_LEN + 1),
    };
    for (const std::string& t : hostile) {
        EXPECT_EQ(-1, Grant(t, "VELA.Demo", "get")) << t;
        EXPECT_STREQ("", user_);
    }
    EXPECT_EQ(-1, VelaAccessTokenGrant(nul.c_str(), "VELA.Demo", "get", user_, sizeof(user_)));
    EXPECT_EQ(-1, VelaAccessTokenGrant(nullptr, "VELA.Demo", "get", user_, sizeof(user_)));
    for (const char* t : {"", "..", "../x", "/etc/passwd", "../../../../../../../x"}) {
        EXPECT_EQ(-2, VelaAccessTokenRevoke(t)) << t;
    }
    EXPECT_EQ(-2, VelaAccessTokenRevoke(nullptr));
    EXPECT_TRUE(log_.Contains("malformed token"));

    EXPECT_EQ(before, Tree(root_.Path()));
    EXPECT_EQ(0, Grant(token, "VELA.Demo", "get"));
}

TEST_F(AccessTokenTest, CorruptFilesGrantNothing)
{
    std::string id;
    const std::string token = Create({"*"}, {"*"}, 0, "root", &id);
    const std::string good = ReadText(File(id));
    Json::Value doc;
    ASSERT_TRUE(VELA::WebAPIUtil::ParseJson(good, doc));

    std::vector<std::string> bad = {"", "garbage", "[]", good.substr(0, good.size() / 2)};
    std::vector<std::pair<std::string, Json::Value>> changes = {
        {"id", "BBBBBBBBBBBBBBBBBBBBBB"}, {"apis", Json::Value(Json::arrayValue)}, {"apis", "*"},
        {"methods", Json::Value(Json::arrayValue)}, {"expires", "never"}, {"user", ""}, {"secret", "short"}};
    changes[3].second.append("a*b");
    for (const std::string& text : JsonVariants(doc, changes, {"version", "id", "secret", "user", "apis", "methods",
                                                               "created", "expires"})) {
        bad.push_back(text);
    }
    for (const std::string& text : bad) {
        WriteFile(File(id), text, 0600);
        EXPECT_EQ(-1, Grant(token, "VELA.Demo", "get")) << text;
        EXPECT_EQ(text, ReadText(File(id)));
    }
    std::vector<VelaAccessTokenRecord> list;
    ASSERT_EQ(0, VelaAccessTokenList(list));
    EXPECT_TRUE(list.empty());
}

TEST_F(AccessTokenTest, ListAndRevoke)
{
    std::string first;
    const std::string a = Create({"VELA.Demo.*"}, {"get*"}, 0, "root", &first);
    Now() += 1;
    std::string second;
    const std::string b = Create({"*"}, {"list"}, 0, "nobody", &second);
    std::ofstream(Dir() + "/not-a-token") << "x";

    std::vector<VelaAccessTokenRecord> list;
    ASSERT_EQ(0, VelaAccessTokenList(list));
    ASSERT_EQ(2u, list.size());
    EXPECT_EQ(first, list[0].id);
    EXPECT_EQ("root", list[0].user);
    EXPECT_EQ(std::vector<std::string>{"VELA.Demo.*"}, list[0].apis);
    EXPECT_EQ(std::vector<std::string>{"get*"}, list[0].methods);
    EXPECT_EQ(second, list[1].id);
    EXPECT_EQ("nobody", list[1].user);

    EXPECT_EQ(0, VelaAccessTokenRevoke(first.c_str()));
    EXPECT_EQ(-1, Grant(a, "VELA.Demo.X", "get"));
    EXPECT_EQ(-2, VelaAccessTokenRevoke(first.c_str()));
    EXPECT_EQ(0, VelaAccessTokenRevoke(b.c_str()));  // the whole token names it too
    EXPECT_EQ(-1, Grant(b, "VELA.Demo.X", "list"));
    ASSERT_EQ(0, VelaAccessTokenList(list));
    EXPECT_TRUE(list.empty());
}

}  // namespace
