#include "workers/backends/BaseUnit.h"

#include <cmath>
#include <mutex>
#include <thread>

#include <fmt/format.h>

#include "platform/Clock.h"
#include "platform/PreferenceStore.h"
#include "session/QVReportingLog.h"
#include "session/QVReportingUtility.h"

namespace qv {

namespace {

constexpr std::uint64_t kSecondsPerWeek = 604800;
constexpr std::uint64_t kSecondsPerDay = 86400;

std::mutex gSleeperMutex;
BaseUnit::Sleeper gSleeper;  // guarded by gSleeperMutex; empty: really sleep

void pauseBetweenPolls() {
    BaseUnit::Sleeper sleeper;
    {
        std::lock_guard lock(gSleeperMutex);
        sleeper = gSleeper;
    }
    if (sleeper) {
        sleeper(BaseUnit::kAvailabilityPollPause);
    } else {
        std::this_thread::sleep_for(BaseUnit::kAvailabilityPollPause);
    }
}

const char* kindName(const Value& v) {
    switch (v.kind()) {
        case Value::Kind::Null:
            return "null";
        case Value::Kind::Bool:
            return "boolean";
        case Value::Kind::Int:
        case Value::Kind::UInt:
        case Value::Kind::Double:
            return "number";
        case Value::Kind::String:
            return "string";
        case Value::Kind::Bytes:
            return "data";
        case Value::Kind::Date:
            return "date";
        case Value::Kind::Array:
            return "list";
        case Value::Kind::Dictionary:
            return "dictionary";
    }
    return "value";
}

bool isNumberKind(const Value& v) {
    const auto k = v.kind();
    return k == Value::Kind::Int || k == Value::Kind::UInt || k == Value::Kind::Double;
}

// Whether a paired device is one whose registration is reported.
bool qualifies(const BluetoothPairedDevice& device) {
    if (!device.accessoryInformation) {
        return false;
    }
    const Value* list = device.accessoryInformation->find(accessory::kTELPVersionInfo);
    const Array* versions = list ? list->asArray() : nullptr;
    if (!versions || versions->size() != BaseUnit::kVersionInfoCount) {
        return false;
    }
    const std::string* model = (*versions)[1].asString();
    return model && *model == BaseUnit::kModel;
}

}  // namespace

BaseUnit::BaseUnit(const Platform& platform, Dictionary& registrationInfoParams)
    : platform_(platform), registrationInfoParams_(registrationInfoParams) {
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "BaseUnit initialize");
}

void BaseUnit::TEST_setSleeper(Sleeper sleeper) {
    std::lock_guard lock(gSleeperMutex);
    gSleeper = std::move(sleeper);
}

std::string_view BaseUnit::sideName(int side) {
    switch (side) {
        case kLeft:
            return "Left";
        case kRight:
            return "Right";
        case kCase:
            return "Case";
    }
    throw BTAccessError(fmt::format("there is no device side {}", side));
}

void BaseUnit::enumerateBluetoothDevices() {
    QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "Enumerate Bluetooth!\n");
    BluetoothFacility& facility = platform_.bluetooth;
    if (!facility.available()) {
        bool available = false;
        for (int poll = 0; poll < kAvailabilityPolls && !available; ++poll) {
            pauseBetweenPolls();
            available = facility.available();
        }
        if (!available) {
            QVLOG_DEBUG(QVReportingAudioRegistrationCategory(),
                        "Timed Out waiting for BT Manager init");
            return;
        }
    }
    devices_.clear();
    for (auto& device : facility.pairedDevices()) {
        if (qualifies(device)) {
            devices_.push_back(std::move(device));
        }
    }
    if (logEnabled(LogLevel::Debug)) {
        Array listed;
        listed.reserve(devices_.size());
        for (const auto& d : devices_) {
            listed.emplace_back(d.identifier);
        }
        QVLOG_DEBUG(QVReportingAudioRegistrationCategory(), "bluetoothPairedDeviceArray: {} - {}",
                    devices_.size(), Value(std::move(listed)).description());
    }
}

const BluetoothPairedDevice& BaseUnit::device(std::size_t index) const {
    if (index >= devices_.size()) {
        throw BTAccessError(
            fmt::format("device {} asked for, but {} are listed", index, devices_.size()));
    }
    return devices_[index];
}

const Array& BaseUnit::versionInfo(std::size_t index) const {
    const BluetoothPairedDevice& d = device(index);
    const Value* list = d.accessoryInformation
                            ? d.accessoryInformation->find(accessory::kTELPVersionInfo)
                            : nullptr;
    if (!list || !list->asArray()) {
        throw BTAccessError(
            fmt::format("device {} has no {} list", d.address, accessory::kTELPVersionInfo));
    }
    return *list->asArray();
}

const Value& BaseUnit::identityElement(std::size_t index, std::size_t element) const {
    const Array& versions = versionInfo(index);
    if (element >= versions.size()) {
        throw BTAccessError(fmt::format("device {} has no element {} in {}", device(index).address,
                                        element, accessory::kTELPVersionInfo));
    }
    const Value& v = versions[element];
    if (!v.isString() && !isNumberKind(v)) {
        throw BTAccessError(
            fmt::format("element {} of {} of device {} is a {}, not a string or "
                        "number",
                        element, accessory::kTELPVersionInfo, device(index).address, kindName(v)));
    }
    return v;
}

void BaseUnit::initializeProductType(int /*side*/, std::size_t deviceIndex) {
    scratch_.set(kAudioModelNumber, identityElement(deviceIndex, 1));
}

void BaseUnit::initializeUUID(int side, std::size_t deviceIndex) {
    static constexpr std::size_t kElement[] = {11, 12, 3};
    const std::string_view name = sideName(side);
    scratch_.set(fmt::format("{}{}", kAudioUUID, name),
                 identityElement(deviceIndex, kElement[side]));
}

void BaseUnit::initializeSerialNumber(int side, std::size_t deviceIndex) {
    // Internal builds report the serial numbers under the identifier's key.
    static constexpr std::size_t kElement[] = {8, 9, 3};
    const std::string_view name = sideName(side);
    scratch_.set(fmt::format("{}{}", kAudioUUID, name),
                 identityElement(deviceIndex, kElement[side]));
}

void BaseUnit::initializeProductVersion(int side, std::size_t deviceIndex) {
    const std::string key = fmt::format("{}{}", kAudioFWVersion, sideName(side));
    if (side != kCase) {
        scratch_.set(key, identityElement(deviceIndex, 10));
        return;
    }
    const BluetoothPairedDevice& d = device(deviceIndex);
    const Value* caseInfo =
        d.accessoryInformation ? d.accessoryInformation->find(accessory::kCaseInfo) : nullptr;
    const Dictionary* info = caseInfo ? caseInfo->asDictionary() : nullptr;
    const Value* version = info ? info->find(accessory::kCaseInfoVersion) : nullptr;
    if (!version) {
        throw BTAccessError(fmt::format("device {} has no {} in its {}", d.address,
                                        accessory::kCaseInfoVersion, accessory::kCaseInfo));
    }
    scratch_.set(key, *version);
}

void BaseUnit::initializePairingDate(int side, std::size_t deviceIndex) {
    if (side == kCase) {
        return;  // the case has no pairing date of its own
    }
    const std::size_t element = side == kLeft ? 13 : 14;
    const Array& versions = versionInfo(deviceIndex);
    const Value& v = versions.at(element);
    const auto epoch = isNumberKind(v) ? v.asDouble() : std::nullopt;
    // A date beyond the 64-bit range or not finite has no day of the week.
    if (!epoch || !std::isfinite(*epoch) || std::fabs(*epoch) >= 9.2e18) {
        throw BTAccessError(fmt::format(
            "element {} of {} of device {} is a {}, not a date in "
            "seconds",
            element, accessory::kTELPVersionInfo, device(deviceIndex).address, kindName(v)));
    }
    const std::int64_t seconds =
        v.kind() == Value::Kind::Double ? static_cast<std::int64_t>(*epoch) : *v.asInt64();
    scratch_.set(fmt::format("{}{}", kAudioFirstPairingDate, sideName(side)),
                 quantizeEpochToDayofWeek(seconds));
}

void BaseUnit::checkForActiveConnection(std::size_t index) {
    PreferenceStore& defaults = platform_.preferences;
    Dictionary lastConnected;
    if (auto stored = defaults.value(kSuite, kLastConnectedKey)) {
        if (const Dictionary* d = stored->asDictionary()) {
            lastConnected = *d;
        }
    }
    const Value& keyElement = versionInfo(index).at(3);
    const std::string* key = keyElement.asString();
    if (!key) {
        throw BTAccessError(fmt::format("element 3 of {} of device {} is a {}, not a string",
                                        accessory::kTELPVersionInfo, device(index).address,
                                        kindName(keyElement)));
    }
    Value epoch = std::uint64_t{0};
    if (platform_.bluetooth.isConnected(device(index).identifier)) {
        epoch = platform_.clock.now();
        lastConnected.set(*key, epoch);
        defaults.setValue(kSuite, kLastConnectedKey, lastConnected);
    } else if (const Value* seen = lastConnected.find(*key)) {
        epoch = *seen;
    }
    scratch_.set(kLastConnectedEpoch, epoch);
}

void BaseUnit::loadParams(int side, std::size_t accessoryIndex) {
    sideName(side);    // refuses a side that does not exist before anything changes
    scratch_.clear();  // what a failed load left behind belongs to no device
    initializeProductType(side, accessoryIndex);
    initializeProductVersion(side, accessoryIndex);
    initializePairingDate(side, accessoryIndex);
    checkForActiveConnection(accessoryIndex);
    if (QVReportingUtilityIsInternalBuild(platform_)) {
        initializeSerialNumber(side, accessoryIndex);
    } else {
        initializeUUID(side, accessoryIndex);
    }

    Array list;
    if (const Value* existing = registrationInfoParams_.find(kSplunkKey)) {
        if (const Array* a = existing->asArray()) {
            list = *a;
        }
    }
    Dictionary entry;
    if (list.size() > accessoryIndex) {
        const Dictionary* current = list[accessoryIndex].asDictionary();
        if (!current) {
            throw BTAccessError(fmt::format("entry {} of the {} list is not a dictionary",
                                            accessoryIndex, kSplunkKey));
        }
        entry = *current;
    }
    entry.merge(scratch_);
    if (list.size() == accessoryIndex) {
        list.emplace_back(std::move(entry));
    } else if (list.size() > accessoryIndex) {
        list[accessoryIndex] = std::move(entry);
    } else {
        throw BTAccessError(fmt::format("entry {} cannot follow the {} entries of the {} list",
                                        accessoryIndex, list.size(), kSplunkKey));
    }
    scratch_.clear();
    registrationInfoParams_.set(kSplunkKey, std::move(list));
}

std::int64_t BaseUnit::quantizeEpochToDayofWeek(std::int64_t epoch) {
    const auto e = static_cast<std::uint64_t>(epoch);
    const std::uint64_t r = e % kSecondsPerWeek;
    const std::uint64_t d = r / kSecondsPerDay;
    const std::uint64_t result =
        (r >= 259200 && r <= 518399) ? e + d * kSecondsPerDay : e - (d + 1) * kSecondsPerDay;
    return static_cast<std::int64_t>(result);
}

}  // namespace qv
