// The sharing context of a request against a real sharing store under a
// fresh VELA_ROOT: the records of the link the header names, copies, the
// sharing URL, and the database (with libsqlite3) left alone by a request
// that names no well-formed link.
#include <gtest/gtest.h>

#include "platform/StateRootTest.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/sharing.h"
#include "webapi/APIRequest.h"

namespace {

using VELA::APIRequest;
using namespace VELA::sharing;

bool SqliteMapped() { return VELA::Test::ReadText("/proc/self/maps").find("libsqlite3") != std::string::npos; }

class SharingContext : public StateRootTest {};

// Runs first in its own process: junk and absent ids never load libsqlite3.
TEST_F(SharingContext, RecordsOfTheNamedLinkAndTheirCopies)
{
    APIRequest plain(J(R"({"environ": {"HTTP_X_VELA_SHARING": "../../x", "HTTP_COOKIE": "sharing_sid=s"}})"));
    EXPECT_TRUE(plain.IsSharing());
    EXPECT_TRUE(plain.GetSharingEntry().empty());
    EXPECT_FALSE(SqliteMapped());

    db::LinkSpec link;
    link.projectName = "photo";
    link.path = "/volume1/photo";
    link.uid = 1;
    link.userName = "daemon";
    record::Entry e;
    ASSERT_TRUE(db::EntryDB(db::SharingDB::Instance()).Create(link, e));
    record::Session s;
    record::Token t;
    ASSERT_EQ(SHARING_STATUS_VALID,
              db::SessionDB(db::SharingDB::Instance()).Create(e.get_hash(), "", "10.0.0.1", 0, s, t));

    Json::Value request(Json::objectValue);
    request["environ"]["HTTP_X_VELA_SHARING"] = e.get_hash();
    APIRequest noCookie(request);  // the link, but no visitor session
    EXPECT_EQ("photo", noCookie.GetSharingEntry().get_project_name());
    EXPECT_TRUE(noCookie.GetSharingSession().empty());
    EXPECT_TRUE(noCookie.GetSharingToken().empty());

    request["environ"]["HTTP_COOKIE"] = std::string(SZK_SHARING_SID) + "=" + s.get_session_id();
    APIRequest visitor(request);
    APIRequest copy(visitor);
    for (const APIRequest* r : {&visitor, &copy}) {
        EXPECT_EQ(e.get_hash(), r->GetSharingID());
        EXPECT_EQ(s.get_session_id(), r->GetSharingSID());
        EXPECT_EQ("/volume1/photo", r->GetSharingEntry().get_path());
        EXPECT_EQ(s.get_session_id(), r->GetSharingSession().get_session_id());
        EXPECT_EQ(e.get_hash(), r->GetSharingToken().get_hash());
    }
    // Another link's id on the same request: its own records, none of the old.
    request["environ"]["HTTP_X_VELA_SHARING"] = "AAAAAAAAAAAAAAAAAAAAAA";
    visitor.InitEnv(request["environ"]);
    EXPECT_TRUE(visitor.GetSharingEntry().empty());
    EXPECT_TRUE(visitor.GetSharingToken().empty());
    EXPECT_FALSE(copy.GetSharingEntry().empty());
}

TEST(SharingURL, DerivedOnceFromHostPortAndApplication)
{
    APIRequest a(J(R"({"environ": {"HTTP_HOST": "nas.example:8443", "HTTPS": "on", "REWRITE_APP": "photo"}})"));
    EXPECT_EQ(SHARING_URL_TYPE_PORT, a.GetSharingURLType());  // before any GetSharingURL
    EXPECT_EQ("https://nas.example:8443/sharing/photo/", a.GetSharingURL("x"));
    APIRequest copy(a);
    EXPECT_EQ(SHARING_URL_TYPE_PORT, copy.GetSharingURLType());

    APIRequest b(J(R"({"environ": {"HTTP_HOST": "nas.example", "HOST": "files", "REWRITE_APP": "photo"}})"));
    EXPECT_EQ("http://nas.example/sharing/files/", b.GetSharingURL("x"));
    EXPECT_EQ(SHARING_URL_TYPE_DIRECT, b.GetSharingURLType());

    APIRequest bad(J(R"({"environ": {"HTTP_HOST": "bad host"}})"));
    EXPECT_EQ("", bad.GetSharingURL("x"));  // refused, and still derived once
    EXPECT_EQ(SHARING_URL_TYPE_NONE, bad.GetSharingURLType());
}

}  // namespace
