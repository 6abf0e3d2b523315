#include <memory>

#include "support/ParamTestUtil.h"
#include "webapi/APIRequest.h"

namespace VELA {
namespace {

using Test::Flags;

const APIRequest::PARAM_NECESSITY REQ = APIRequest::REQUIRED;
const APIRequest::PARAM_NECESSITY OPT = APIRequest::OPTIONAL;

// A request whose parameters are the JSON object `params`.
std::unique_ptr<APIRequest> Request(const std::string& params)
{
    Json::Value request(Json::objectValue);
    request["getParam"] = J(params);
    return std::unique_ptr<APIRequest>(new APIRequest(request));
}

bool Positive(long long const& v) { return v > 0; }

TEST(GetAndCheck, BasicAndIntegralTypes)
{
    auto req = Request(R"({"i":5,"s":"5","b":true,"r":3,"big":2147483648,"a":[1],"o":{"k":"v"}})");
    EXPECT_EQ(req->GetAndCheckInt("i", REQ).Get(), 5);
    EXPECT_EQ(Flags(req->GetAndCheckInt("s", REQ)), "SI");
    EXPECT_EQ(Flags(req->GetAndCheckInt("big", OPT)), "SI");
    EXPECT_EQ(req->GetAndCheckString("s", REQ).Get(), "5");
    EXPECT_EQ(Flags(req->GetAndCheckString("i", REQ)), "SI");
    EXPECT_TRUE(req->GetAndCheckBool("b", REQ).Get(false));
    EXPECT_EQ(Flags(req->GetAndCheckBool("s", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckReal("r", REQ).Get(), 3.0);
    EXPECT_EQ(Flags(req->GetAndCheckReal("b", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckArray("a", REQ).Get(), J("[1]"));
    EXPECT_EQ(Flags(req->GetAndCheckArray("o", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckObject("o", REQ).Get(), J(R"({"k":"v"})"));
    EXPECT_EQ(Flags(req->GetAndCheckObject("a", REQ)), "SI");

    // Integral types of every width, with a validator.
    req = Request(R"({"big":2147483648,"neg":-1,"zero":0,"huge":18446744073709551615})");
    EXPECT_EQ(req->GetAndCheckIntegral<long long>("big", REQ).Get(), 2147483648LL);
    EXPECT_EQ(req->GetAndCheckIntegral<long long>("neg", REQ).Get(), -1);
    EXPECT_EQ(Flags(req->GetAndCheckIntegral<long long>("huge", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckIntegral<unsigned int>("big", REQ).Get(), 2147483648u);
    EXPECT_EQ(Flags(req->GetAndCheckIntegral<unsigned int>("neg", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckIntegral<unsigned long long>("huge", REQ).Get(), 18446744073709551615ULL);
    EXPECT_EQ(Flags(req->GetAndCheckIntegral<unsigned long long>("neg", REQ)), "SI");

    APIParameter<long long> zero = req->GetAndCheckIntegral<long long>("zero", REQ, Positive);
    EXPECT_EQ(Flags(zero), "SI");
    EXPECT_EQ(zero.Get(5), 5);
    EXPECT_EQ(req->GetAndCheckIntegral<long long>("big", REQ, Positive).Get(5), 2147483648LL);
}

TEST(GetAndCheck, MissingAndNull)
{
    auto req = Request(R"({"z":null})");
    APIParameter<int> required = req->GetAndCheckInt("n", REQ);
    EXPECT_EQ(Flags(required), "I");
    EXPECT_EQ(required.Get(9), 9);
    APIParameter<std::string> optional = req->GetAndCheckString("n", OPT);
    EXPECT_EQ(Flags(optional), "");
    EXPECT_TRUE(optional.SetDefault("d"));
    EXPECT_EQ(optional.Get(), "d");
    EXPECT_EQ(Flags(req->GetAndCheckObject("z", REQ)), "SR");
}

bool IsPair(Json::Value const& v) { return v.size() == 2; }

TEST(GetAndCheckUnitArray, WrapsSingleValues)
{
    auto req = Request(R"({"s":"a","z":null,"a":["x","y"],"o":{"k":1}})");
    APIParameter<Json::Value> single = req->GetAndCheckUnitArray("s", REQ);
    EXPECT_EQ(Flags(single), "S");
    EXPECT_EQ(single.Get(), J(R"(["a"])"));
    APIParameter<Json::Value> null = req->GetAndCheckUnitArray("z", REQ);
    EXPECT_EQ(Flags(null), "S");
    EXPECT_EQ(null.Get(), J("[null]"));
    EXPECT_EQ(req->GetAndCheckUnitArray("a", REQ).Get(), J(R"(["x","y"])"));
    EXPECT_EQ(req->GetAndCheckUnitArray("o", REQ).Get(), J(R"([{"k":1}])"));

    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("n", REQ)), "I");
    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("n", OPT)), "");
    // The validator sees the wrapped array.
    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("s", REQ, IsPair)), "SI");
    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("a", REQ, IsPair)), "S");
}

}  // namespace
}  // namespace VELA
