#include "platform/clock.h"

#include "base/Format.h"

#include <ctime>

namespace tally::platform {

std::string iso8601LocalDate(std::chrono::system_clock::time_point instant, char separator) {
    using namespace std::chrono;
    const auto whole = floor<seconds>(instant); // before 1970 too, milliseconds count upwards
    const auto thousandths = static_cast<int>(duration_cast<milliseconds>(instant - whole).count());
    const std::time_t seconds = system_clock::to_time_t(whole);
    std::tm local{};
    localtime_r(&seconds, &local);
    char date[32];
    char time[16];
    char offset[8] = ""; // "+0200"
    std::strftime(date, sizeof date, "%Y-%m-%d", &local);
    std::strftime(time, sizeof time, "%H:%M:%S", &local);
    std::strftime(offset, sizeof offset, "%z", &local);
    const std::string_view zone(offset, 5);
    const std::string shownZone =
        zone.substr(1) == "0000" ? "Z" : std::string(zone.substr(0, 3)) + ":" + std::string(zone.substr(3));
    return formatted("%s%c%s.%03d%s", date, separator, time, thousandths, shownZone.c_str());
}

} // namespace tally::platform
