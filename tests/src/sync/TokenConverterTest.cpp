// The token converter: access tokens the camera accepts, and no manager meaning empty tokens.
#include "TokenConverter.h"
#include "FakeWemlo.h"
#include "LogFacility.h"

#include <gtest/gtest.h>

TEST(TokenConverter, AccessTokensAreFreshAndAcceptedByTheCameraOfThePairToken)
{
    TokenConverter converter;
    const std::string pairToken = Zelto::GeneratePairToken();
    const std::string first = converter.genAccessToken(pairToken);
    const std::string second = converter.genAccessToken(pairToken);
    EXPECT_FALSE(first.empty());
    EXPECT_NE(first, second);

    auto camera = Zelto::CreateProtectedAPIManager("", 0, true);
    camera->SetPairToken(pairToken.data(), pairToken.size(), true);
    EXPECT_TRUE(camera->VerifyAccessToken(first));
    EXPECT_TRUE(camera->VerifyAccessToken(second));
    // A token for another pair token is not accepted.
    EXPECT_FALSE(camera->VerifyAccessToken(converter.genAccessToken(Zelto::GeneratePairToken())));
}

TEST(TokenConverter, MissingManagerGivesEmptyTokensAndOneLogLine)
{
    fakeWemloReset();
    LogFacility::reload(FAKE_WEMLO_PATH);
    TokenConverter converter(nullptr);
    EXPECT_EQ(converter.genAccessToken("pair"), std::string());
    EXPECT_EQ(converter.genAccessToken("pair"), std::string());
    const FakeWemloState state = fakeWemloState();
    ASSERT_EQ(state.lines.size(), 1u);
    EXPECT_NE(state.lines[0].text.find("TokenConverter::TokenConverter, CreateProtectedAPIManager failure"),
              std::string::npos);
    fakeWemloReset();
}
