#include "platform/linux/bluetooth/LinuxBluetoothFacility.h"

#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include <fmt/format.h>
#include <sdbus-c++/sdbus-c++.h>
#include <systemd/sd-bus.h>

#include "platform/linux/bluetooth/AccessoryInformationFile.h"

namespace qv {

namespace {

constexpr const char* kBlueZName = "org.bluez";
constexpr const char* kDevice1 = "org.bluez.Device1";
constexpr const char* kObjectManager = "org.freedesktop.DBus.ObjectManager";
constexpr const char* kBusDaemon = "org.freedesktop.DBus";
constexpr const char* kNoOwner = "org.freedesktop.DBus.Error.NameHasNoOwner";

using ManagedObjects =
    std::map<sdbus::ObjectPath, std::map<std::string, std::map<std::string, sdbus::Variant>>>;

// Text from the bus, fit for one log line: control characters escaped, at most 64 bytes.
std::string printable(std::string_view text) {
    constexpr std::size_t kLongest = 64;
    std::string out;
    for (const char c : text.substr(0, kLongest)) {
        const auto u = static_cast<unsigned char>(c);
        if (u < 0x20 || u == 0x7f || c == '"' || c == '\\') {
            out += fmt::format("\\x{:02x}", u);
        } else {
            out += c;
        }
    }
    if (text.size() > kLongest) {
        out += "...";
    }
    return out;
}

// Why the bus cannot be reached now, or nothing when it can. The binding keeps the half-made bus
// of a connection that fails, so a bus that stays away would cost memory at every attempt: it is
// tried with sd-bus first, which gives everything back.
std::optional<std::string> unreachable(const std::string& bus) {
    sd_bus* probe = nullptr;
    int r = 0;
    if (bus == "system") {
        r = sd_bus_open_system(&probe);
    } else {
        r = sd_bus_new(&probe);
        if (r >= 0) {
            r = sd_bus_set_address(probe, bus.c_str());
        }
        if (r >= 0) {
            r = sd_bus_set_bus_client(probe, 1);
        }
        if (r >= 0) {
            r = sd_bus_start(probe);
        }
    }
    sd_bus_flush_close_unref(probe);
    if (r < 0) {
        return std::string(std::strerror(-r));
    }
    return std::nullopt;
}

std::unique_ptr<sdbus::IConnection> connectTo(const std::string& bus) {
    if (bus == "system") {
        return sdbus::createSystemBusConnection();
    }
    return sdbus::createSessionBusConnectionWithAddress(bus);
}

std::uint64_t monotonicMicros() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<std::uint64_t>(ts.tv_sec) * 1000000u +
           static_cast<std::uint64_t>(ts.tv_nsec) / 1000u;
}

int millisUntil(std::chrono::steady_clock::time_point when) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        when - std::chrono::steady_clock::now());
    return static_cast<int>(std::clamp<std::int64_t>(left.count(), 0, 60000));
}

}  // namespace

std::optional<bool> LinuxBluetoothFacility::boolProperty(const std::string& path, const char* name,
                                                         const sdbus::Variant& value) const {
    if (!value.containsValueOfType<bool>()) {
        note(LogLevel::Error, fmt::format("BlueZ: {} of {} is not a boolean; ignored", name, path));
        return std::nullopt;
    }
    return value.get<bool>();
}

// One connection to the bus with its proxies and signal subscriptions; lives on the facility's
// thread only.
class LinuxBluetoothFacility::Session {
  public:
    Session(LinuxBluetoothFacility& facility, std::unique_ptr<sdbus::IConnection> connection)
        : facility_(facility), connection_(std::move(connection)) {
        busDaemon_ = sdbus::createProxy(*connection_, kBusDaemon, "/org/freedesktop/DBus");
        // Broker-side filters keep other services' traffic away; the sender is checked again on
        // arrival, against the owner of org.bluez that this session knows.
        slots_.push_back(connection_->addMatch(
            "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
            "member='NameOwnerChanged',path='/org/freedesktop/DBus',arg0='org.bluez'",
            [this](sdbus::Message& m) {
                guarded("NameOwnerChanged", [&] { onNameOwnerChanged(m); });
            }));
        slots_.push_back(connection_->addMatch(
            "type='signal',sender='org.bluez',interface='org.freedesktop.DBus.ObjectManager',"
            "member='InterfacesAdded'",
            [this](sdbus::Message& m) {
                guarded("InterfacesAdded", [&] { onInterfacesAdded(m); });
            }));
        slots_.push_back(connection_->addMatch(
            "type='signal',sender='org.bluez',interface='org.freedesktop.DBus.ObjectManager',"
            "member='InterfacesRemoved'",
            [this](sdbus::Message& m) {
                guarded("InterfacesRemoved", [&] { onInterfacesRemoved(m); });
            }));
        slots_.push_back(connection_->addMatch(
            "type='signal',sender='org.bluez',interface='org.freedesktop.DBus.Properties',"
            "member='PropertiesChanged',arg0='org.bluez.Device1'",
            [this](sdbus::Message& m) {
                guarded("PropertiesChanged", [&] { onPropertiesChanged(m); });
            }));
    }

    // Serves until the bus breaks (sdbus::Error) or the facility stops.
    void serve() {
        resyncAt_ = std::chrono::steady_clock::now();
        while (!facility_.stopping_) {
            if (resyncAt_ && std::chrono::steady_clock::now() >= *resyncAt_) {
                resyncAt_.reset();
                resync();
            }
            while (connection_->processPendingRequest()) {
                if (facility_.stopping_) {
                    return;
                }
            }
            facility_.readMarkedAccessories();
            if (resyncAt_ && std::chrono::steady_clock::now() >= *resyncAt_) {
                continue;
            }
            waitForWork();
        }
    }

  private:
    void note(LogLevel level, const std::string& line) const { facility_.note(level, line); }

    // A signal that cannot be read is logged and dropped; nothing is thrown back into the bus
    // library's dispatch.
    template <typename F>
    void guarded(const char* what, F&& handle) {
        try {
            handle();
        } catch (const sdbus::Error& e) {
            note(LogLevel::Error, fmt::format("BlueZ: a {} signal could not be read: {} {}", what,
                                              e.getName(), e.getMessage()));
        }
    }

    void waitForWork() {
        const auto data = connection_->getEventLoopPollData();
        int timeoutMs = 60000;
        if (data.timeout_usec != UINT64_MAX) {
            const std::uint64_t now = monotonicMicros();
            timeoutMs = data.timeout_usec <= now
                            ? 0
                            : static_cast<int>(std::min<std::uint64_t>(
                                  (data.timeout_usec - now + 999) / 1000, 60000));
        }
        if (resyncAt_) {
            timeoutMs = std::min(timeoutMs, millisUntil(*resyncAt_));
        }
        if (facility_.watch_ < 0) {
            timeoutMs = std::min(timeoutMs, millisUntil(facility_.nextWatchAttempt_));
        }
        pollfd fds[3] = {{data.fd, static_cast<short>(data.events), 0},
                         {facility_.stopFd_, POLLIN, 0},
                         {facility_.inotifyFd_, POLLIN, 0}};
        const nfds_t count = facility_.inotifyFd_ >= 0 ? 3 : 2;
        if (::poll(fds, count, timeoutMs) < 0 && errno != EINTR) {
            note(LogLevel::Error, fmt::format("BlueZ: poll failed: {}", std::strerror(errno)));
        }
        if (count == 3 && (fds[2].revents & POLLIN)) {
            facility_.drainDirectoryEvents();
        }
        if (facility_.watch_ < 0 &&
            std::chrono::steady_clock::now() >= facility_.nextWatchAttempt_) {
            facility_.watchDirectory();
        }
    }

    // Learns who owns org.bluez and reads all its objects.
    void resync() {
        std::string owner;
        try {
            auto call = busDaemon_->createMethodCall(kBusDaemon, "GetNameOwner");
            call << std::string(kBlueZName);
            auto reply = busDaemon_->callMethod(call, timeoutMicros());
            reply >> owner;
        } catch (const sdbus::Error& e) {
            if (e.getName() != kNoOwner) {
                failResync(e);
                return;
            }
        }
        if (owner.empty()) {
            loseOwner();
            return;
        }
        ManagedObjects objects;
        try {
            auto bluez = sdbus::createProxy(*connection_, owner, "/");
            auto call = bluez->createMethodCall(kObjectManager, "GetManagedObjects");
            auto reply = bluez->callMethod(call, timeoutMicros());
            reply >> objects;
        } catch (const sdbus::Error& e) {
            failResync(e);
            return;
        }
        owner_ = owner;
        std::size_t paired = 0;
        std::size_t total = 0;
        {
            std::lock_guard lock(facility_.mutex_);
            facility_.devices_.clear();
            for (const auto& [path, interfaces] : objects) {
                if (auto it = interfaces.find(kDevice1); it != interfaces.end()) {
                    facility_.applyDevicePropertiesLocked(path, it->second, true);
                }
            }
            facility_.available_ = true;
            facility_.markAllAccessoriesLocked();
            total = facility_.devices_.size();
            for (const auto& [path, device] : facility_.devices_) {
                paired += device.paired ? 1 : 0;
            }
        }
        facility_.readMarkedAccessories();
        facility_.syncCount_.fetch_add(1);
        note(LogLevel::Default,
             fmt::format("BlueZ: org.bluez is {}; {} paired of {} devices", owner, paired, total));
    }

    void failResync(const sdbus::Error& e) {
        note(LogLevel::Error,
             fmt::format("BlueZ: cannot read the objects of org.bluez: {} {}; trying "
                         "again in {} ms",
                         e.getName(), e.getMessage(), kResyncRetry.count()));
        {
            std::lock_guard lock(facility_.mutex_);
            facility_.clearLocked();
        }
        owner_.clear();
        resyncAt_ = std::chrono::steady_clock::now() + kResyncRetry;
    }

    void loseOwner() {
        bool was = false;
        {
            std::lock_guard lock(facility_.mutex_);
            was = facility_.available_;
            facility_.clearLocked();
        }
        owner_.clear();
        note(LogLevel::Default,
             fmt::format("BlueZ: org.bluez has no owner{}; Bluetooth is unavailable",
                         was ? " any longer" : ""));
    }

    void onNameOwnerChanged(sdbus::Message& m) {
        std::string name, oldOwner, newOwner;
        m >> name >> oldOwner >> newOwner;
        if (name != kBlueZName) {
            return;
        }
        if (newOwner.empty()) {
            loseOwner();
        } else {
            resyncAt_ = std::chrono::steady_clock::now();
        }
    }

    bool fromOwner(const sdbus::Message& m) const {
        return !owner_.empty() && m.getSender() == owner_;
    }

    void onInterfacesAdded(sdbus::Message& m) {
        if (!fromOwner(m)) {
            return;
        }
        sdbus::ObjectPath path;
        std::map<std::string, Properties> interfaces;
        m >> path >> interfaces;
        auto it = interfaces.find(kDevice1);
        if (it == interfaces.end()) {
            return;
        }
        std::lock_guard lock(facility_.mutex_);
        facility_.applyDevicePropertiesLocked(path, it->second, true);
    }

    void onInterfacesRemoved(sdbus::Message& m) {
        if (!fromOwner(m)) {
            return;
        }
        sdbus::ObjectPath path;
        std::vector<std::string> interfaces;
        m >> path >> interfaces;
        if (std::find(interfaces.begin(), interfaces.end(), kDevice1) == interfaces.end()) {
            return;
        }
        std::lock_guard lock(facility_.mutex_);
        facility_.devices_.erase(path);
    }

    void onPropertiesChanged(sdbus::Message& m) {
        if (!fromOwner(m)) {
            return;
        }
        std::string interface;
        Properties changed;
        m >> interface >> changed;
        if (interface != kDevice1) {
            return;
        }
        const std::string path = m.getPath();
        std::lock_guard lock(facility_.mutex_);
        // A device not announced is not made up from a fragment of its properties.
        if (facility_.devices_.count(path) != 0) {
            facility_.applyDevicePropertiesLocked(path, changed, false);
        }
    }

    static std::uint64_t timeoutMicros() {
        return static_cast<std::uint64_t>(
            std::chrono::duration_cast<std::chrono::microseconds>(kCallTimeout).count());
    }

    static constexpr std::chrono::milliseconds kResyncRetry{5000};

    LinuxBluetoothFacility& facility_;
    std::unique_ptr<sdbus::IConnection> connection_;
    std::unique_ptr<sdbus::IProxy> busDaemon_;
    std::vector<sdbus::Slot> slots_;
    // Unique name of the owner of org.bluez whose objects were read; empty while none.
    std::string owner_;
    std::optional<std::chrono::steady_clock::time_point> resyncAt_;
};

LinuxBluetoothFacility::LinuxBluetoothFacility(std::string bus, std::string accessoryDirectory,
                                               LogCallback log, std::function<void()> fileRefused)
    : bus_(std::move(bus)),
      accessoryDirectory_(std::move(accessoryDirectory)),
      log_(std::move(log)),
      fileRefused_(std::move(fileRefused)) {
    stopFd_ = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (stopFd_ < 0) {
        note(LogLevel::Error, fmt::format("BlueZ: eventfd failed: {}; Bluetooth is unavailable",
                                          std::strerror(errno)));
        return;
    }
    thread_ = std::thread([this] { run(); });
}

LinuxBluetoothFacility::~LinuxBluetoothFacility() {
    stopping_ = true;
    if (thread_.joinable()) {
        const std::uint64_t one = 1;
        [[maybe_unused]] const auto n = ::write(stopFd_, &one, sizeof one);
        thread_.join();
    }
    if (inotifyFd_ >= 0) {
        ::close(inotifyFd_);
    }
    if (stopFd_ >= 0) {
        ::close(stopFd_);
    }
}

bool LinuxBluetoothFacility::available() const {
    std::lock_guard lock(mutex_);
    return available_;
}

std::vector<BluetoothPairedDevice> LinuxBluetoothFacility::pairedDevices() const {
    std::lock_guard lock(mutex_);
    std::vector<BluetoothPairedDevice> out;
    if (!available_) {
        return out;
    }
    for (const auto& [path, device] : devices_) {
        if (!device.paired) {
            continue;
        }
        BluetoothPairedDevice d;
        d.identifier = path;
        d.address = device.address;
        d.connected = device.connected;
        if (auto it = accessories_.find(device.address);
            !device.address.empty() && it != accessories_.end()) {
            d.accessoryInformation = it->second.information;
        }
        out.push_back(std::move(d));
    }
    return out;
}

bool LinuxBluetoothFacility::isConnected(std::string_view identifier) const {
    std::lock_guard lock(mutex_);
    auto it = devices_.find(std::string(identifier));
    return available_ && it != devices_.end() && it->second.connected;
}

void LinuxBluetoothFacility::run() {
    pthread_setname_np(pthread_self(), "qvreportd-bluez");
    watchDirectory();
    auto retry = kFirstRetry;
    bool failureLogged = false;
    while (!stopping_) {
        std::unique_ptr<sdbus::IConnection> connection;
        try {
            if (auto why = unreachable(bus_)) {
                throw sdbus::Error("org.freedesktop.DBus.Error.NoServer", *why);
            }
            connection = connectTo(bus_);
        } catch (const sdbus::Error& e) {
            // Logged once per outage: an absent bus is a normal state of some hosts.
            if (!failureLogged) {
                note(LogLevel::Error,
                     fmt::format(
                         "BlueZ: cannot reach the bus {}: {}; Bluetooth is unavailable until "
                         "it can be reached",
                         bus_, e.getMessage()));
                failureLogged = true;
            }
            pause(retry);
            retry = std::min(retry * 2, kLongestRetry);
            continue;
        }
        retry = kFirstRetry;
        failureLogged = false;
        note(LogLevel::Info, fmt::format("BlueZ: connected to the bus {}", bus_));
        try {
            Session session(*this, std::move(connection));
            session.serve();
        } catch (const sdbus::Error& e) {
            note(LogLevel::Error,
                 fmt::format("BlueZ: lost the bus {}: {} {}", bus_, e.getName(), e.getMessage()));
        }
        {
            std::lock_guard lock(mutex_);
            clearLocked();
        }
        if (!stopping_) {
            pause(kFirstRetry);
        }
    }
}

void LinuxBluetoothFacility::pause(std::chrono::milliseconds timeout) {
    pollfd fd{stopFd_, POLLIN, 0};
    ::poll(&fd, 1, static_cast<int>(timeout.count()));
}

void LinuxBluetoothFacility::clearLocked() {
    available_ = false;
    devices_.clear();
}

void LinuxBluetoothFacility::applyDevicePropertiesLocked(const std::string& path,
                                                         const Properties& properties, bool fresh) {
    auto it = devices_.find(path);
    if (it == devices_.end()) {
        if (devices_.size() >= kMaxDevices) {
            if (!tooManyLogged_) {
                note(LogLevel::Error,
                     fmt::format("BlueZ: more than {} devices; {} and any further ones are ignored",
                                 kMaxDevices, path));
                tooManyLogged_ = true;
            }
            return;
        }
        it = devices_.emplace(path, Device{}).first;
    } else if (fresh) {
        it->second = Device{};
    }
    Device& device = it->second;
    if (auto p = properties.find("Paired"); p != properties.end()) {
        device.paired = boolProperty(path, "Paired", p->second).value_or(device.paired);
    }
    if (auto p = properties.find("Connected"); p != properties.end()) {
        device.connected = boolProperty(path, "Connected", p->second).value_or(device.connected);
    }
    if (auto p = properties.find("Address"); p != properties.end()) {
        std::optional<std::string> canonical;
        if (p->second.containsValueOfType<std::string>()) {
            const auto text = p->second.get<std::string>();
            canonical = QVReportingCanonicalBluetoothAddress(text);
            if (!canonical) {
                note(
                    LogLevel::Error,
                    fmt::format("BlueZ: device {} has the address \"{}\", which is not a Bluetooth "
                                "address; it has no accessory information",
                                path, printable(text)));
            }
        } else {
            note(
                LogLevel::Error,
                fmt::format("BlueZ: Address of {} is not a string; it has no accessory information",
                            path));
        }
        device.address = canonical.value_or("");
        if (canonical && accessories_.count(*canonical) == 0) {
            marked_.push_back(*canonical);
        }
    }
}

}  // namespace qv
