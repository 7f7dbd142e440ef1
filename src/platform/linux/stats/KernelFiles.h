// Reading the kernel's counter files under /proc and /sys: small files read whole and bounded,
// numbers and names as the kernel prints them, directory listings in natural order, and
// /proc/interrupts summed over CPUs.
//
// Thread safety: pure functions over the files they are given.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace qv::kernelfiles {

constexpr std::size_t kMaxNameBytes = 255;
// A kernel counter file is a line; anything longer than this is not one.
constexpr std::size_t kSmallFileBytes = 4096;
// /proc/interrupts grows with the number of CPUs and lines; this bounds what one read keeps.
constexpr std::size_t kLargeFileBytes = 4 * 1024 * 1024;

// /proc/interrupts, summed over CPUs: IRQ number to count, and the action list of each line.
struct InterruptLine {
    std::uint64_t count = 0;
    std::string actions;
};

// Reads the file whole (at most limit bytes); 0 or the errno of the failure.
int readFile(const std::string& path, std::string& out, std::size_t limit);

std::string_view trim(std::string_view s);

// A whole unsigned decimal number, blanks around it allowed.
std::optional<std::uint64_t> parseUnsigned(std::string_view text);

// A file holding one unsigned number: 0 or the error (EINVAL for anything but a number).
int readCounter(const std::string& path, std::uint64_t& value);

std::uint64_t saturatingMultiply(std::uint64_t a, std::uint64_t b);

// Names as channels carry them: trimmed, without control characters, at most 255 bytes and
// never cut inside a UTF-8 sequence.
std::string cleanName(std::string_view raw);

std::optional<std::string> readName(const std::string& path);

std::string lower(std::string_view s);

bool containsAny(const std::string& haystack, std::initializer_list<std::string_view> needles);

// Orders "cpu2" before "cpu10": runs of digits compare as numbers.
bool naturalLess(const std::string& a, const std::string& b);

// Entries of a directory whose names start with prefix followed by digits only, in natural
// order; empty when the directory cannot be read.
std::vector<std::string> numberedEntries(const std::string& dir, std::string_view prefix);

std::vector<std::string> allEntries(const std::string& dir);

bool exists(const std::string& path);

// /proc/interrupts read into lines (IRQ number to the line's count summed over CPUs, and its
// actions when wantActions): 0 or the errno of the read.
int readInterrupts(const std::string& path, std::map<unsigned, InterruptLine>& lines,
                   bool wantActions);

}  // namespace qv::kernelfiles
