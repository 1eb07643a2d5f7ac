#include "Values/Error.h"

#include <gtest/gtest.h>

#include <set>

namespace veltoid {
namespace {

TEST(Error, SaysWhereItWasMadeAndKeepsTheGivenInformation) {
    const Error error =
        makeError(-101, {"reason", nullptr, "suggestion"}, {{"more", "x"}}, "function", nullptr, 7);
    EXPECT_EQ(error.domain.view(), kIdentityErrorDomain);
    EXPECT_EQ(error.userInfo, (Dictionary{{"more", "x"},
                                          {kErrorFailureReasonKey, "reason"},
                                          {kErrorRecoverySuggestionKey, "suggestion"},
                                          {"function", "function"},
                                          {"file", "-"},
                                          {"line", Value::int64(7)}}));
}

TEST(Error, EveryCodeHasAText) {
    std::set<std::string> texts;
    for (const int64_t code :
         {99, 1, -1, -2, -99, -101, -102, -103, -104, -105, -106, -107, -108, -114, -100}) {
        const Error error = VELTOID_ERROR(code);
        EXPECT_TRUE(texts.insert(error.userInfo.string(kErrorDescriptionKey).text()).second) << code;
        EXPECT_EQ(error.userInfo["file"], Value("Error_test.cpp"));
    }
    const Error other = makeStatusError("text", "f", "g", 1);
    EXPECT_EQ(other.domain.view(), kOSStatusErrorDomain);
    EXPECT_EQ(other.userInfo.string(kErrorDescriptionKey), "text");
}

TEST(Error, SurvivesTheWayThroughADictionaryWithWhatLiesUnderneath) {
    const Error deepest{"HTTP", 500, {}};
    const Error fault{String(kXMLErrorDomain), -20101, {{kErrorUnderlyingErrorKey, deepest}}};
    const Error error = makeError(-100, {}, {{kErrorUnderlyingErrorKey, fault}}, "f", "g", 1);
    const Dictionary dictionary = errorToDictionary(error);
    EXPECT_EQ(
        dictionary.dictionary("UserInfo")->dictionary(kErrorUnderlyingErrorKey)->string("Domain").view(),
        kXMLErrorDomain);
    EXPECT_EQ(dictionaryToError(dictionary), error);
}

TEST(Error, DictionariesOfAnotherShapeAreNone) {
    for (const Value& none : {Value(), Value("text"), Value(Dictionary{{"Domain", "d"}}),
                              Value(Dictionary{{"Domain", "d"}, {"Code", "1"}}),
                              Value(Dictionary{{"Domain", "d"}, {"Code", Value::real(1.5)}})})
        EXPECT_EQ(dictionaryToError(none), std::nullopt);
    const auto odd =
        dictionaryToError(Dictionary{{"Domain", "d"},
                                     {"Code", Value::int32(1)},
                                     {"UserInfo", Dictionary{{kErrorUnderlyingErrorKey, "text"}}}});
    ASSERT_TRUE(odd);
    EXPECT_EQ(odd->userInfo.string(kErrorUnderlyingErrorKey), "text") << "what is no error stays as it is";
}

TEST(Error, EndlessChainsEnd) {
    Dictionary chain{{"Domain", "d"}, {"Code", Value::int32(0)}};
    for (int i = 0; i < 1'000; ++i)
        chain = {{"Domain", "d"},
                 {"Code", Value::int32(i)},
                 {"UserInfo", Dictionary{{kErrorUnderlyingErrorKey, chain}}}};
    const auto error = dictionaryToError(chain);
    ASSERT_TRUE(error);
    EXPECT_TRUE(errorToDictionary(*error).contains("UserInfo"));
}

}  // namespace
}  // namespace veltoid
