// The local zone as the store gets it: read anew on each call, standard bias whatever the season.

#include "PlatformHelper.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>
#include <string>

TEST(PlatformHelper, LocalZoneFollowsTheZoneOfTheMoment)
{
    const char* previous = std::getenv("TZ");
    const std::string saved = previous ? previous : "";
    // POSIX zone names count west as positive; "EST5EDT" is five hours west, daylight time or not.
    for (const auto& [zone, bias] :
         {std::pair{"UTC-8", -480}, std::pair{"UTC+3:30", 210}, std::pair{"EST5EDT", 300}}) {
        ::setenv("TZ", zone, 1);
        const PlatformHelper::LocalZone local = PlatformHelper::localZone();
        const std::time_t now = std::time(nullptr);
        std::tm parts = {};
        ::localtime_r(&now, &parts);
        EXPECT_EQ(std::pair(local.standardBiasMinutes, local.daylightNow),
                  std::pair(bias, parts.tm_isdst > 0))
            << zone;
    }
    previous ? ::setenv("TZ", saved.c_str(), 1) : ::unsetenv("TZ");
    ::tzset();
}
