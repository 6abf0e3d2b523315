// Access tokens against real files under a temporary VELA_ROOT: grants,
// patterns, expiry, users that went away, hostile tokens, corrupt files,
// listing and revocation.
#include <gtest/gtest.h>

#include "platform/StateRootTest.h"

#include <cstring>
#include <dirent.h>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "support/TestSupport.h"
#include "vela/session.h"
#include "vela/token.h"
#include "vela/vlibc.h"
#include "vela/webapiutil.h"

namespace {

using VELA::Test::LogCapture;
using VELA::Test::ReadText;
using VELA::Test::ScopedEnv;
using VELA::Test::TempDir;


std::set<std::string> Names(const std::string& dir)
{
    std::set<std::string> names;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    while (struct dirent* ent = readdir(d)) {
        names.insert(ent->d_name);
    }
    closedir(d);
    return names;
}

class AccessTokenTest : public StateRootTest {
protected:
    std::string Dir() const { return root_.Path() + "/var/lib/vela/tokens"; }
    std::string File(const std::string& id) const { return Dir() + "/" + id; }

    std::string Create(const std::vector<std::string>& apis, const std::vector<std::string>& methods,
                       long long lifetime = 0, const char* user = "root", std::string* id = nullptr)
    {
        std::string token;
        std::string tid;
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

    void Edit(const std::string& id, const char* key, const Json::Value& value)
    {
        Json::Value doc;
        ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(File(id), doc));
        doc[key] = value;
        ASSERT_TRUE(VELA::WebAPIUtil::WriteJsonFileAtomic(File(id), doc, 0600));
    }

    LogCapture log_;
    char user_[493];
};

TEST_F(AccessTokenTest, CreateWritesPrivateFile)
{
    std::string id;
    const std::string token = Create({"VELA.Demo.*"}, {"get*", "list"}, 3600, "root", &id);
    EXPECT_EQ('.', token[VELA_TOKEN_ID_LEN]);
    struct stat st;
    ASSERT_EQ(0, stat(Dir().c_str(), &st));
    EXPECT_EQ(0700u, st.st_mode & 0777);
    ASSERT_EQ(0, stat(File(id).c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777);

    Json::Value doc;
    ASSERT_TRUE(VELA::WebAPIUtil::ReadJsonFile(File(id), doc));
    EXPECT_EQ("root", doc["user"].asString());
    EXPECT_EQ(token.substr(VELA_TOKEN_ID_LEN + 1), doc["secret"].asString());
    EXPECT_EQ(kStart + 3600, doc["expires"].asInt64());
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
    EXPECT_EQ(0, Grant(token, "VELA.Demo.Test", "get"));
    EXPECT_STREQ("root", user_);
    EXPECT_EQ(0, Grant(token, "VELA.Demo.Test", "getInfo"));
    EXPECT_EQ(0, Grant(token, "VELA.Exact", "list"));
    EXPECT_EQ(-3, Grant(token, "VELA.Demo", "get"));  // the prefix includes the "."
    EXPECT_EQ(-3, Grant(token, "VELA.Exact2", "get"));
    EXPECT_EQ(-3, Grant(token, "VELA.Other.Test", "get"));
    EXPECT_EQ(-3, Grant(token, "vela.demo.test", "get"));  // case-sensitive
    EXPECT_EQ(-3, Grant(token, "VELA.Demo.Test", "set"));
    EXPECT_EQ(-3, Grant(token, "VELA.Demo.Test", "Get"));
    EXPECT_EQ(-3, Grant(token, "VELA.Demo.Test", "listAll"));
    EXPECT_STREQ("", user_);
    EXPECT_EQ(-3, Grant(token, "", "get"));
    EXPECT_EQ(-3, Grant(token, "VELA.Demo.../x", "get"));
    EXPECT_EQ(-3, Grant(token, "VELA.Demo.Test", nullptr));
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

TEST_F(AccessTokenTest, UserMustStillExist)
{
    std::string id;
    const std::string token = Create({"*"}, {"*"}, 0, "nobody", &id);
    EXPECT_EQ(0, Grant(token, "VELA.Demo", "get"));
    EXPECT_STREQ("nobody", user_);
    Edit(id, "user", "vela-no-such-user");  // the user was deleted
    EXPECT_EQ(-4, Grant(token, "VELA.Demo", "get"));
    EXPECT_STREQ("", user_);

    std::string tok = "stale";
    std::string tid = "stale";
    EXPECT_EQ(-1, VelaAccessTokenCreate("vela-no-such-user", {"*"}, {"*"}, 0, tok, tid));
    EXPECT_TRUE(tok.empty());
    EXPECT_TRUE(tid.empty());
    EXPECT_TRUE(log_.Contains("no user \"vela-no-such-user\""));
}

TEST_F(AccessTokenTest, CreateRefusesBadInput)
{
    std::string token;
    std::string id;
    EXPECT_EQ(-1, VelaAccessTokenCreate("root", {}, {"get"}, 0, token, id));
    EXPECT_EQ(-1, VelaAccessTokenCreate("root", {"VELA.Demo"}, {}, 0, token, id));
    for (const char* bad : {"", "a*b", "*x", "**", "a b", "../x", "VELA/Demo", "a\n"}) {
        EXPECT_EQ(-1, VelaAccessTokenCreate("root", {bad}, {"get"}, 0, token, id)) << bad;
        EXPECT_EQ(-1, VelaAccessTokenCreate("root", {"VELA.Demo"}, {bad}, 0, token, id)) << bad;
        EXPECT_FALSE(VelaAccessTokenIsPattern(bad)) << bad;
    }
    EXPECT_EQ(-1, VelaAccessTokenCreate("root", {std::string(129, 'a')}, {"get"}, 0, token, id));
    EXPECT_EQ(-1, VelaAccessTokenCreate("root", std::vector<std::string>(33, "a"), {"get"}, 0, token, id));
    EXPECT_EQ(-1, VelaAccessTokenCreate("root", {"*"}, {"*"}, -1, token, id));
    EXPECT_EQ(-1, VelaAccessTokenCreate("root", {"*"}, {"*"}, VELA_TOKEN_LIFETIME_MAX + 1, token, id));
    EXPECT_EQ(-1, VelaAccessTokenCreate(nullptr, {"*"}, {"*"}, 0, token, id));
    EXPECT_EQ(-1, VelaAccessTokenCreate("a/b", {"*"}, {"*"}, 0, token, id));
    EXPECT_TRUE(token.empty());
    EXPECT_TRUE(Names(Dir()).size() <= 2);  // nothing but "." and ".." at most
}

TEST_F(AccessTokenTest, HostileTokensTouchNothing)
{
    std::string id;
    const std::string token = Create({"*"}, {"*"}, 0, "root", &id);
    std::ofstream(root_.Path() + "/x") << "outside";
    const std::set<std::string> before = Names(Dir());
    const std::string beforeText = ReadText(File(id));

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

    EXPECT_EQ(before, Names(Dir()));
    EXPECT_EQ(beforeText, ReadText(File(id)));
    EXPECT_EQ("outside", ReadText(root_.Path() + "/x"));
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
    auto mutate = [&](const char* key, const Json::Value& value) {
        Json::Value changed = doc;
        if (value.isNull()) {
            changed.removeMember(key);
        } else {
            changed[key] = value;
        }
        bad.push_back(Json::writeString(Json::StreamWriterBuilder(), changed));
    };
    for (const char* key : {"version", "id", "secret", "user", "apis", "methods", "created", "expires"}) {
        mutate(key, Json::Value());
    }
    mutate("id", "BBBBBBBBBBBBBBBBBBBBBB");
    mutate("apis", Json::Value(Json::arrayValue));
    mutate("apis", "*");
    Json::Value badList(Json::arrayValue);
    badList.append("a*b");
    mutate("methods", badList);
    mutate("expires", "never");
    mutate("user", "");
    mutate("secret", "short");

    for (const std::string& text : bad) {
        {
            std::ofstream out(File(id), std::ios::binary | std::ios::trunc);
            out << text;
        }
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

TEST_F(AccessTokenTest, UserBuffer)
{
    const std::string token = Create({"*"}, {"*"});
    char small[4] = "xx";
    EXPECT_EQ(-5, VelaAccessTokenGrant(token.c_str(), "VELA.Demo", "get", small, sizeof(small)));
    EXPECT_STREQ("", small);
    EXPECT_EQ(-5, VelaAccessTokenGrant(token.c_str(), "VELA.Demo", "get", nullptr, 493));
    char exact[5];
    EXPECT_EQ(0, VelaAccessTokenGrant(token.c_str(), "VELA.Demo", "get", exact, sizeof(exact)));
    EXPECT_STREQ("root", exact);
}

}  // namespace
