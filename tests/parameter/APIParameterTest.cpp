#include <initializer_list>

#include "support/ParamTestUtil.h"

namespace VELA {
namespace {

using Test::Flags;

// {"n": <literal>} read as a required T.
template <typename T> APIParameter<T> Member(const std::string& literal)
{
    return APIParameterFactoryBasicImpl<T>::FromJson(J("{\"n\":" + literal + "}"), "n", PARAM_REQUIRED);
}

template <typename T> void Accepted(const std::string& literal, T const& expected)
{
    APIParameter<T> p = Member<T>(literal);
    EXPECT_EQ(Flags(p), "S") << literal;
    EXPECT_EQ(p.Get(), expected) << literal;
}

template <typename T> void Refused(std::initializer_list<const char*> literals)
{
    for (const char* literal : literals) {
        EXPECT_EQ(Flags(Member<T>(literal)), "SI") << literal;
    }
}

// Per type: the range it takes, the JSON types it refuses.
TEST(ParseValue, RangesAndTypesOfEachType)
{
    Accepted<int>("2147483647", 2147483647);
    Accepted<int>("-2147483648", -2147483647 - 1);
    Accepted<int>("3.0", 3);
    Refused<int>({"2147483648", "-2147483649", "3.5", "\"5\"", "true", "[1]"});
    Accepted<long long>("2147483648", 2147483648LL);
    Accepted<long long>("-9223372036854775808", -9223372036854775807LL - 1);
    Refused<long long>({"9223372036854775808", "18446744073709551615", "1e19", "1.5"});
    Accepted<unsigned int>("4294967295", 4294967295u);
    Refused<unsigned int>({"-1", "4294967296"});
    Accepted<unsigned long long>("18446744073709551615", 18446744073709551615ULL);
    Refused<unsigned long long>({"-1", "\"1\""});
    Accepted<bool>("false", false);
    Refused<bool>({"\"true\"", "1"});
    Accepted<double>("3", 3.0);
    Accepted<double>("18446744073709551615", 18446744073709551615.0);
    Refused<double>({"\"3\"", "true"});
    Accepted<std::string>("\"x\"", std::string("x"));
    Refused<std::string>({"5"});

    // A refused value leaves the stored one alone.
    APIParameter<Json::Value> j;
    EXPECT_TRUE(j.ParseValue(J("[1]"), Json::arrayValue));
    EXPECT_FALSE(j.ParseValue(J("{}"), Json::arrayValue));
    EXPECT_EQ(j.Get(), J("[1]"));
}

int g_validatorCalls = 0;

bool Positive(int const& v)
{
    ++g_validatorCalls;
    return v > 0;
}

TEST(CheckValueTypeAndGet, NullIsResetValidatorDecides)
{
    g_validatorCalls = 0;
    APIParameter<int> p;
    EXPECT_TRUE(p.CheckValueTypeAndGet(Json::Value(), Json::nullValue, Positive));
    EXPECT_EQ(g_validatorCalls, 0);
    EXPECT_EQ(Flags(p), "SR");
    EXPECT_TRUE(p.SetDefault(7));
    EXPECT_EQ(p.Get(9), 0);
    EXPECT_EQ(Flags(p), "SR");

    APIParameter<int> refused;
    EXPECT_FALSE(refused.CheckValueTypeAndGet(Json::Value(0), Json::nullValue, Positive));
    EXPECT_EQ(Flags(refused), "SI");
    EXPECT_EQ(refused.Get(), 0);
    EXPECT_EQ(refused.Get(5), 5);
    EXPECT_FALSE(refused.SetDefault(5));
    EXPECT_EQ(refused.Get(), 0);

    APIParameter<int> accepted;
    EXPECT_TRUE(accepted.CheckValueTypeAndGet(Json::Value(3), Json::nullValue, Positive));
    EXPECT_EQ(accepted.Get(5), 3);

    // A value of the wrong type never reaches the validator.
    g_validatorCalls = 0;
    APIParameter<int> wrongType;
    EXPECT_FALSE(wrongType.CheckValueTypeAndGet(Json::Value("3"), Json::nullValue, Positive));
    EXPECT_EQ(g_validatorCalls, 0);
}

TEST(Factory, MissingMemberArrayAndObject)
{
    Json::Value obj = J("{\"other\":1}");
    APIParameter<int> required = APIParameterFactoryBasicImpl<int>::FromJson(obj, "n", PARAM_REQUIRED);
    EXPECT_EQ(Flags(required), "I");
    EXPECT_EQ(required.Get(9), 9);

    APIParameter<int> optional = APIParameterFactoryBasicImpl<int>::FromJson(obj, "n", PARAM_OPTIONAL);
    EXPECT_EQ(Flags(optional), "");
    EXPECT_TRUE(optional.SetDefault(9));
    EXPECT_EQ(Flags(optional), "SD");
    EXPECT_TRUE(optional.SetDefault(4));
    EXPECT_EQ(optional.Get(), 9);

    for (const char* notObject : {"[1]", "null", "\"n\""}) {
        EXPECT_EQ(Flags(APIParameterFactoryBasicImpl<std::string>::FromJson(J(notObject), "n", PARAM_OPTIONAL)),
                  "I");
    }

    Json::Value mixed = J("{\"a\":[1,2],\"o\":{\"k\":1},\"z\":null}");
    APIParameter<Json::Value> array = APIParameterFactory::ArrayFromJson(mixed, "a", PARAM_REQUIRED);
    EXPECT_EQ(Flags(array), "S");
    EXPECT_EQ(array.Get(), mixed["a"]);
    APIParameter<Json::Value> notArray = APIParameterFactory::ArrayFromJson(mixed, "o", PARAM_REQUIRED);
    EXPECT_EQ(Flags(notArray), "SI");
    EXPECT_TRUE(notArray.Get().isNull());

    EXPECT_EQ(APIParameterFactory::ObjectFromJson(mixed, "o", PARAM_REQUIRED).Get(), mixed["o"]);
    EXPECT_EQ(Flags(APIParameterFactory::ObjectFromJson(mixed, "a", PARAM_REQUIRED)), "SI");
    EXPECT_EQ(Flags(APIParameterFactory::ObjectFromJson(mixed, "z", PARAM_REQUIRED)), "SR");
    EXPECT_EQ(Flags(APIParameterFactory::ArrayFromJson(J("[]"), "n", PARAM_OPTIONAL)), "I");
}

TEST(APIParameter, CopyAndCompare)
{
    APIParameter<std::string> source = Member<std::string>("\"v\"");
    source.MarkReset();
    source.MarkDefault();
    source.MarkInvalid();
    APIParameter<std::string> copy(source);
    APIParameter<std::string> assigned;
    assigned = source;
    EXPECT_EQ(Flags(copy), "SRID");
    EXPECT_EQ(Flags(assigned), "SRID");
    EXPECT_EQ(copy.Get(), "v");
    EXPECT_TRUE(assigned.ParseValue(Json::Value("w"), Json::nullValue));
    EXPECT_EQ(copy.Get(), "v");

    // Values only: the flags differ.
    APIParameter<std::string> other = Member<std::string>("\"v\"");
    EXPECT_TRUE(other == copy);
    EXPECT_FALSE(other != copy);
    EXPECT_TRUE(other != assigned);
    EXPECT_TRUE(other == "v");
    EXPECT_TRUE(other != "w");
}

}  // namespace
}  // namespace VELA
