// The gauge-data writer on Linux: a results file in JSON, one value a line, written as values
// come (through a buffer of kChunkBytes), so a file of a hundred thousand values costs little
// memory:
//   {"name": "QVReporting", "version": 4, "values": [
//   {"name": "decode", "unit": "milliseconds", "value": 12.345},
//   ...
//   ]}
// Names and units that are not valid UTF-8 have their bad bytes replaced; values that are not
// finite are written as null (JSON has no NaN or infinity); other doubles with every digit needed
// to read them back. The file is created with O_NOFOLLOW, so a symbolic link planted at its path
// is refused (ELOOP) rather than followed.
//
// Thread safety: open() may be called from any thread; a file belongs to its caller.
#pragma once

#include "platform/GaugeDataWriter.h"

namespace qv {

class LinuxGaugeDataWriter final : public GaugeDataWriter {
  public:
    // Bytes gathered before they are written.
    static constexpr std::size_t kChunkBytes = 256 * 1024;

    // EINVAL for options other than 0; otherwise the error of creating the file, if any.
    Opened open(const std::filesystem::path& path, std::string_view name, int version,
                int options) override;
};

}  // namespace qv
