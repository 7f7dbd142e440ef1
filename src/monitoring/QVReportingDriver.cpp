#include "monitoring/QVReportingDriver.h"

#include <fmt/format.h>

namespace qv {

namespace {

std::string_view textOf(const std::optional<std::string>& name) {
    return name ? std::string_view(*name) : std::string_view("(null)");
}

}  // namespace

QVReportingDriver QVReportingDriver::driverWithGroupName(std::optional<std::string> groupName,
                                                         std::optional<std::string> subGroupName) {
    QVReportingDriver driver;
    driver.groupName_ = std::move(groupName);
    driver.subGroupName_ = std::move(subGroupName);
    return driver;
}

std::string QVReportingDriver::description() const {
    return fmt::format("{}-{}", textOf(groupName_), textOf(subGroupName_));
}

QVReportingIOChannelSubscription QVReportingIOChannelSubscription::initWithDriver(
    QVReportingDriver driver) {
    return QVReportingIOChannelSubscription(std::move(driver));
}

}  // namespace qv
