#pragma once
// Access tokens for cameras that protect their object metadata.
//
// Contract:
// - A camera hands out a pair token once (GeneratePairToken). A client feeds it into a manager and
//   asks for an access token on every use; the camera checks it with a manager of its own fed with
//   the same pair token (VerifyAccessToken). Both sides run this code.
// - An access token carries the time step it was made in (30 s steps of the manager's clock) and a
//   random nonce, sealed with HMAC-SHA256 over the pair token and the manager's secret. It is
//   accepted only within a step of the verifier's clock, so a client and a camera whose clocks
//   disagree by more than about a minute are refused.
// - Tokens (pair and access) hold only URL-safe characters: A-Z a-z 0-9 '-' '_'.
// - Managers are plain objects without locks: use one from one thread at a time. Failures are
//   values: an empty access token, false.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace Zelto {

class IProtectedAPIMgr
{
public:
    virtual ~IProtectedAPIMgr() = default;

    // Feeds the pair token in (bytes, not necessarily terminated). With replace false an earlier
    // pair token is kept. Returns whether a non-empty pair token is now held.
    virtual bool SetPairToken(const char* data, size_t length, bool replace) = 0;

    // Camera side: whether accessToken was made from the pair token held, in a time step close
    // enough to this manager's present one.
    virtual bool VerifyAccessToken(const std::string& accessToken) const = 0;

    // A new access token for the pair token held and the present time step; empty without one.
    virtual std::string GetAccessToken() = 0;
};

// Seconds since 1970-01-01 UTC.
using Clock = std::function<int64_t()>;

struct ManagerOptions
{
    std::string secret;       // mixed into every token; both sides must agree
    int64_t stepSeconds = 30; // length of one time step
    int toleranceSteps = 1;   // neighbouring steps the verifier accepts each way
    Clock clock;              // empty: the system clock
};

// data/length: the secret shared by the site's clients and cameras (empty for none).
// flag: true accepts tokens from the neighbouring time steps, false only from the present one.
std::unique_ptr<IProtectedAPIMgr> CreateProtectedAPIManager(const char* data, size_t length, bool flag);

// The same with every option spelt out (tests set the clock here).
std::unique_ptr<IProtectedAPIMgr> CreateProtectedAPIManager(const ManagerOptions& options);

// A fresh random pair token, as a camera hands it out.
std::string GeneratePairToken();

} // namespace Zelto
