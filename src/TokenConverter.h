#pragma once
// Turns a camera's pair token into a fresh access token through the token library. Owns the
// library's manager. Used from the synchroniser's thread only.

#include "Zelto.h"

#include <memory>
#include <string>

class TokenConverter
{
public:
    TokenConverter();
    // Takes the given manager (tests hand in one with their own clock); null is allowed.
    explicit TokenConverter(std::unique_ptr<Zelto::IProtectedAPIMgr> manager);
    virtual ~TokenConverter();

    TokenConverter(const TokenConverter&) = delete;
    TokenConverter& operator=(const TokenConverter&) = delete;

    // Empty when the library gave no manager: the request then goes out on the unprotected path.
    virtual std::string genAccessToken(const std::string& pairToken);

private:
    std::unique_ptr<Zelto::IProtectedAPIMgr> m_protectedAPIMgr;
};
