// A gauge-data writer that keeps what it is given. Opening creates the file (empty), so that the
// caller can move it. openError makes open() fail with that error number.
#pragma once

#include <fstream>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/GaugeDataWriter.h"

namespace qv::test {

class FakeGaugeDataWriter : public GaugeDataWriter {
  public:
    struct Entry {
        std::string name;
        std::string unit;
        double value;
    };
    struct File {
        std::filesystem::path path;
        std::vector<Entry> values;
        bool closed = false;
    };

    Opened open(const std::filesystem::path& path, std::string_view, int, int) override {
        std::lock_guard lock(mutex_);
        if (openError != 0) {
            return {nullptr, openError};
        }
        std::ofstream(path, std::ios::trunc);
        auto file = std::make_shared<File>();
        file->path = path;
        files.push_back(file);
        return {std::make_unique<Handle>(files.back()), 0};
    }

    int openError = 0;
    std::vector<std::shared_ptr<File>> files;  // every file opened, in order

  private:
    class Handle : public GaugeDataFile {
      public:
        explicit Handle(std::shared_ptr<File> file) : file_(std::move(file)) {}
        void addValue(std::string_view name, std::string_view unit, double value) override {
            file_->values.push_back({std::string(name), std::string(unit), value});
        }
        int close() override {
            file_->closed = true;
            return 0;
        }

      private:
        std::shared_ptr<File> file_;
    };

    std::mutex mutex_;
};

}  // namespace qv::test
