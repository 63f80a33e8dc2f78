#include "value/Value.h"

#include <gtest/gtest.h>

namespace mx {
namespace {

TEST(ValueTest, CopiesShareStorageUntilOneIsWritten)
{
    Dictionary original{{"rate", 48000}, {"route", "Speaker"}};
    Dictionary copy = original;
    copy.set("rate", 44100);
    copy.set("extra", true);
    EXPECT_EQ(*original.find("rate"), Value(48000));
    EXPECT_FALSE(original.contains("extra"));
    EXPECT_EQ(*copy.find("rate"), Value(44100));

    Array items{1, 2};
    Array grown = items;
    grown.append(3);
    EXPECT_EQ(items.size(), 2u);
    EXPECT_EQ(grown.size(), 3u);
}

TEST(ValueTest, DictionaryKeepsInsertionOrderAndReplacesInPlace)
{
    Dictionary dictionary;
    for (const char* key : {"z", "a", "m"})
        dictionary.set(key, 1);
    dictionary.set("a", 2);
    std::vector<std::string> keys;
    for (const auto& [key, value] : dictionary)
        keys.push_back(key);
    EXPECT_EQ(keys, (std::vector<std::string>{"z", "a", "m"}));
    EXPECT_EQ(*dictionary.find("a"), Value(2));
    dictionary.erase("a");
    EXPECT_EQ(dictionary, (Dictionary{{"z", 1}, {"m", 1}}));
}

TEST(ValueTest, LargeDictionariesStayIndexedThroughEveryChange)
{
    Dictionary dictionary;
    for (int i = 0; i < 100000; ++i)
        dictionary.set("key" + std::to_string(i), i);
    dictionary.set("key5", -5);
    dictionary.erase("key7");
    EXPECT_EQ(dictionary.size(), 99999u);
    EXPECT_EQ(*dictionary.find("key5"), Value(-5));
    EXPECT_EQ(*dictionary.find("key99999"), Value(99999));
    EXPECT_FALSE(dictionary.contains("key7"));
    Dictionary copy = dictionary;
    copy.set("key8", 0);
    EXPECT_EQ(*dictionary.find("key8"), Value(8));
}

TEST(ValueTest, DescriptionIsOneDeterministicTextForm)
{
    using namespace std::chrono;
    EXPECT_EQ(Value("plain").description(), "plain");
    EXPECT_EQ(Value(48000).description(), "48000");
    EXPECT_EQ(Value(18446744073709551615ull).description(), "18446744073709551615");
    EXPECT_EQ(Value(12.5).description(), "12.5");
    EXPECT_EQ(Value(true).description(), "true");
    EXPECT_EQ(Value().description(), "null");
    EXPECT_EQ(Value(Data{0x0a, 0xff}).description(), "<0aff>");
    EXPECT_EQ(Value(Date(seconds(1700000000) + milliseconds(250))).description(), "2023-11-14T22:13:20.25Z");
    EXPECT_EQ(Value(Array{1, "a \"b\"", Dictionary{{"k", Array{}}}}).description(), R"([1,"a \"b\"",{"k":[]}])");
}

TEST(ValueTest, NumbersReadAsIntegersLikeACastWould)
{
    EXPECT_EQ(Value(4.99).int64Value(), 4);
    EXPECT_EQ(Value(-4.99).int64Value(), -4);
    EXPECT_EQ(Value(1e300).int64Value(), INT64_MAX);
    EXPECT_EQ(Value(true).int64Value(), 1);
    EXPECT_EQ(Value("5").int64Value(), 0);
    EXPECT_EQ(Value(18446744073709551615ull).int64Value(), -1);
}

} // namespace
} // namespace mx

#include <nlohmann/json.hpp>

#include "value/JsonValue.h"

namespace mx {
namespace {

TEST(JsonValueTest, TextWriterMatchesTheJsonTreeAndAlwaysParses)
{
    Value value = Dictionary{{"text", "quote \" slash \\ tab \t bell \x07 é"},
                             {"whole", 2.0},
                             {"tiny", 1e-7},
                             {"int", -3},
                             {"big", 18446744073709551615ull},
                             {"nan", std::nan("")},
                             {"list", Array{nullptr, true, Data{0xff}}},
                             {"when", Date(std::chrono::seconds(1))}};
    EXPECT_EQ(toJsonText(value), toJson(value).dump());
    auto broken = toJsonText(Value(std::string("a\xff\xc3")));
    EXPECT_EQ(nlohmann::json::parse(broken), "a\xef\xbf\xbd\xef\xbf\xbd");
}

} // namespace
} // namespace mx
