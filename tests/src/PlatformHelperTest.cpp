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
    // Biases count west as positive. Dublin marks its winter as daylight time (negative saving):
    // its standard time is still the smaller offset, as on Windows.
    for (const auto& [zone, bias] :
         {std::pair{"Europe/Dublin", 0}, std::pair{"Europe/Berlin", -60}, std::pair{"America/New_York", 300},
          std::pair{"Australia/Sydney", -600}, std::pair{"Asia/Kolkata", -330}, std::pair{"UTC", 0}}) {
        ::setenv("TZ", zone, 1);
        const PlatformHelper::LocalZone local = PlatformHelper::localZone();
        const std::time_t now = std::time(nullptr);
        std::tm parts = {};
        ::localtime_r(&now, &parts);
        EXPECT_EQ(std::pair(local.standardBiasMinutes, local.daylightNow),
                  std::pair(bias, parts.tm_gmtoff != -bias * 60L))
            << zone;
    }
    previous ? ::setenv("TZ", saved.c_str(), 1) : ::unsetenv("TZ");
    ::tzset();
}
