// The gauge-data writer: a results file of named measurements, each a name, a unit and a value,
// under the results' own name and format version. The trace worker writes one value per probe
// event, in milliseconds.
//
// Thread safety: the writer may be used from any thread; one open file is used by one thread at
// a time.
#pragma once

#include <filesystem>
#include <memory>
#include <string_view>

namespace qv {

// One open results file.
class GaugeDataFile {
  public:
    virtual ~GaugeDataFile() = default;

    // Adds one value. A value that cannot be written makes close() fail.
    virtual void addValue(std::string_view name, std::string_view unit, double value) = 0;
    // Finishes the file: 0 when it is complete on disk, else the system error number of the
    // first failure. Called once; the destructor closes a file that was not closed.
    virtual int close() = 0;
};

class GaugeDataWriter {
  public:
    struct Opened {
        std::unique_ptr<GaugeDataFile> file;  // null on failure
        int error = 0;                        // the system error number when file is null
    };

    virtual ~GaugeDataWriter() = default;

    // Creates (or truncates) the results file at path, named name, in format version version.
    // options: no option is defined; give 0.
    virtual Opened open(const std::filesystem::path& path, std::string_view name, int version,
                        int options) = 0;
};

}  // namespace qv
