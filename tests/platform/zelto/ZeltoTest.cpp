// Access tokens: both sides run the same derivation, tokens are URL-safe, and clocks that
// disagree by more than the tolerance are refused.
#include "Zelto.h"

#include <gtest/gtest.h>

#include <atomic>
#include <set>

namespace {

bool urlSafe(const std::string& text)
{
    for (char c : text) {
        const bool ok = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
                        c == '-' || c == '_';
        if (!ok) {
            return false;
        }
    }
    return !text.empty();
}

struct Side
{
    std::atomic<int64_t> now{1'700'000'000};
    std::unique_ptr<Zelto::IProtectedAPIMgr> manager;

    explicit Side(const std::string& pairToken, int tolerance = 1, std::string secret = std::string())
    {
        Zelto::ManagerOptions options;
        options.secret = std::move(secret);
        options.toleranceSteps = tolerance;
        options.clock = [this]() { return now.load(); };
        manager = Zelto::CreateProtectedAPIManager(options);
        manager->SetPairToken(pairToken.data(), pairToken.size(), true);
    }
};

} // namespace

TEST(Zelto, TokensAreUrlSafeFreshEachTimeAndAcceptedByTheCamera)
{
    const std::string pairToken = Zelto::GeneratePairToken();
    EXPECT_TRUE(urlSafe(pairToken));
    EXPECT_NE(pairToken, Zelto::GeneratePairToken());

    Side client(pairToken), camera(pairToken);
    std::set<std::string> seen;
    for (int i = 0; i < 20; ++i) {
        const std::string token = client.manager->GetAccessToken();
        EXPECT_TRUE(urlSafe(token)) << token;
        EXPECT_TRUE(camera.manager->VerifyAccessToken(token));
        seen.insert(token);
    }
    EXPECT_EQ(seen.size(), 20u);
}

TEST(Zelto, ClocksApartBeyondOneStepAreRefused)
{
    const std::string pairToken = Zelto::GeneratePairToken();
    Side client(pairToken), camera(pairToken), strictCamera(pairToken, 0);
    client.now = 1'700'000'010; // the first second of a 30 s step
    camera.now = client.now + 45;
    EXPECT_TRUE(camera.manager->VerifyAccessToken(client.manager->GetAccessToken()));
    camera.now = client.now - 25;
    EXPECT_TRUE(camera.manager->VerifyAccessToken(client.manager->GetAccessToken()));
    camera.now = client.now + 90;
    EXPECT_FALSE(camera.manager->VerifyAccessToken(client.manager->GetAccessToken()));
    camera.now = client.now - 70;
    EXPECT_FALSE(camera.manager->VerifyAccessToken(client.manager->GetAccessToken()));

    strictCamera.now = client.now + 5;
    EXPECT_TRUE(strictCamera.manager->VerifyAccessToken(client.manager->GetAccessToken()));
    strictCamera.now = client.now + 35; // next step
    EXPECT_FALSE(strictCamera.manager->VerifyAccessToken(client.manager->GetAccessToken()));
}

TEST(Zelto, WrongPairTokenSecretOrTamperingIsRefused)
{
    const std::string pairToken = Zelto::GeneratePairToken();
    Side client(pairToken), otherPair(Zelto::GeneratePairToken()), otherSecret(pairToken, 1, "site");
    const std::string token = client.manager->GetAccessToken();
    EXPECT_FALSE(otherPair.manager->VerifyAccessToken(token));
    EXPECT_FALSE(otherSecret.manager->VerifyAccessToken(token));

    Side camera(pairToken);
    std::string tampered = token;
    tampered.back() = tampered.back() == 'A' ? 'B' : 'A';
    EXPECT_FALSE(camera.manager->VerifyAccessToken(tampered));
    EXPECT_FALSE(camera.manager->VerifyAccessToken(std::string()));
    EXPECT_FALSE(camera.manager->VerifyAccessToken("not a token at all"));
}

TEST(Zelto, ManagerWithoutPairTokenGivesEmptyTokenAndKeepsTheFirstWhenAsked)
{
    auto manager = Zelto::CreateProtectedAPIManager("", 0, true);
    ASSERT_TRUE(manager);
    EXPECT_EQ(manager->GetAccessToken(), std::string());
    EXPECT_FALSE(manager->SetPairToken(nullptr, 0, true));
    EXPECT_FALSE(manager->VerifyAccessToken("x"));

    const std::string first = Zelto::GeneratePairToken(), second = Zelto::GeneratePairToken();
    EXPECT_TRUE(manager->SetPairToken(first.data(), first.size(), true));
    EXPECT_TRUE(manager->SetPairToken(second.data(), second.size(), false));
    auto camera = Zelto::CreateProtectedAPIManager("", 0, true);
    camera->SetPairToken(first.data(), first.size(), true);
    EXPECT_TRUE(camera->VerifyAccessToken(manager->GetAccessToken()));
}
