#include "TokenConverter.h"

#include "LogFacility.h"

namespace {

std::unique_ptr<Zelto::IProtectedAPIMgr> checked(std::unique_ptr<Zelto::IProtectedAPIMgr> manager)
{
    if (!manager) {
        DELVIX_LOG(LogFacility::LevelError, "%s, CreateProtectedAPIManager failure, access tokens stay empty",
                   "TokenConverter::TokenConverter");
    }
    return manager;
}

} // namespace

TokenConverter::TokenConverter()
    : m_protectedAPIMgr(checked(Zelto::CreateProtectedAPIManager("", 0, true)))
{}

TokenConverter::TokenConverter(std::unique_ptr<Zelto::IProtectedAPIMgr> manager)
    : m_protectedAPIMgr(checked(std::move(manager)))
{}

TokenConverter::~TokenConverter() = default;

std::string TokenConverter::genAccessToken(const std::string& pairToken)
{
    if (!m_protectedAPIMgr) {
        return std::string(); // logged once, when the manager was not given
    }
    m_protectedAPIMgr->SetPairToken(pairToken.data(), pairToken.size(), true);
    return m_protectedAPIMgr->GetAccessToken();
}
