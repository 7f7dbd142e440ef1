#include "platform/linux/trace/LinuxGaugeDataWriter.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <string>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

#include "platform/PosixIO.h"

namespace qv {

namespace {

void appendJsonString(std::string& out, std::string_view text) {
    out += nlohmann::json(std::string(text))
               .dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

class LinuxGaugeDataFile final : public GaugeDataFile {
  public:
    LinuxGaugeDataFile(int fd, std::string_view name, int version) : fd_(fd) {
        pending_.reserve(LinuxGaugeDataWriter::kChunkBytes + 512);
        pending_ += "{\"name\": ";
        appendJsonString(pending_, name);
        pending_ += fmt::format(", \"version\": {}, \"values\": [\n", version);
    }
    ~LinuxGaugeDataFile() override {
        if (fd_ >= 0) {
            close();
        }
    }
    LinuxGaugeDataFile(const LinuxGaugeDataFile&) = delete;
    LinuxGaugeDataFile& operator=(const LinuxGaugeDataFile&) = delete;

    void addValue(std::string_view name, std::string_view unit, double value) override {
        if (fd_ < 0) {
            return;
        }
        if (count_++ > 0) {
            pending_ += ",\n";
        }
        pending_ += "{\"name\": ";
        appendJsonString(pending_, name);
        pending_ += ", \"unit\": ";
        appendJsonString(pending_, unit);
        pending_ += ", \"value\": ";
        if (std::isfinite(value)) {
            fmt::format_to(std::back_inserter(pending_), "{}", value);
        } else {
            pending_ += "null";
        }
        pending_ += '}';
        if (pending_.size() >= LinuxGaugeDataWriter::kChunkBytes) {
            writePending();
        }
    }

    int close() override {
        if (fd_ < 0) {
            return EBADF;
        }
        pending_ += count_ > 0 ? "\n]}\n" : "]}\n";
        writePending();
        error_ = syncAndClose(fd_, error_);
        fd_ = -1;
        return error_;
    }

  private:
    void writePending() {
        // After a failure the rest is dropped: the file is incomplete either way, and close()
        // reports the first error.
        if (error_ == 0 && !writeAll(fd_, pending_)) {
            error_ = errno;
        }
        pending_.clear();
    }

    int fd_;
    int error_ = 0;
    std::size_t count_ = 0;
    std::string pending_;
};

}  // namespace

GaugeDataWriter::Opened LinuxGaugeDataWriter::open(const std::filesystem::path& path,
                                                   std::string_view name, int version,
                                                   int options) {
    if (options != 0) {
        return {nullptr, EINVAL};
    }
    const int fd =
        ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644);
    if (fd < 0) {
        return {nullptr, errno};
    }
    return {std::make_unique<LinuxGaugeDataFile>(fd, name, version), 0};
}

}  // namespace qv
