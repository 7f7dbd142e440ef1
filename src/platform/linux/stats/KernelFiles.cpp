#include "platform/linux/stats/KernelFiles.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <limits>

namespace qv::kernelfiles {

// Reads the file whole (at most limit bytes); 0 or the errno of the failure.
int readFile(const std::string& path, std::string& out, std::size_t limit) {
    out.clear();
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    char buffer[kSmallFileBytes];
    int error = 0;
    while (out.size() < limit) {
        const ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            error = errno;
            break;
        }
        if (n == 0) {
            break;
        }
        out.append(buffer, static_cast<std::size_t>(std::min<std::size_t>(n, limit - out.size())));
    }
    ::close(fd);
    return error;
}

std::string_view trim(std::string_view s) {
    while (!s.empty() && std::isspace(static_cast<unsigned char>(s.front()))) {
        s.remove_prefix(1);
    }
    while (!s.empty() && std::isspace(static_cast<unsigned char>(s.back()))) {
        s.remove_suffix(1);
    }
    return s;
}

// A whole unsigned decimal number, blanks around it allowed.
std::optional<std::uint64_t> parseUnsigned(std::string_view text) {
    text = trim(text);
    std::uint64_t value = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (text.empty() || ec != std::errc() || end != text.data() + text.size()) {
        return std::nullopt;
    }
    return value;
}

// A file holding one unsigned number: 0 or the error (EINVAL for anything but a number).
int readCounter(const std::string& path, std::uint64_t& value) {
    std::string text;
    if (const int error = readFile(path, text, kSmallFileBytes)) {
        return error;
    }
    const auto parsed = parseUnsigned(text);
    if (!parsed) {
        return EINVAL;
    }
    value = *parsed;
    return 0;
}

std::uint64_t saturatingMultiply(std::uint64_t a, std::uint64_t b) {
    std::uint64_t product = 0;
    return __builtin_mul_overflow(a, b, &product) ? std::numeric_limits<std::uint64_t>::max()
                                                  : product;
}

// Names as channels carry them: trimmed, without control characters, at most 255 bytes and
// never cut inside a UTF-8 sequence.
std::string cleanName(std::string_view raw) {
    raw = trim(raw);
    std::string name(raw.substr(0, kMaxNameBytes));
    if (raw.size() > kMaxNameBytes) {
        while (!name.empty() && (static_cast<unsigned char>(name.back()) & 0xC0) == 0x80) {
            name.pop_back();
        }
        if (!name.empty() && static_cast<unsigned char>(name.back()) >= 0xC0) {
            name.pop_back();
        }
    }
    for (char& c : name) {
        const auto u = static_cast<unsigned char>(c);
        if (u < 0x20 || u == 0x7F) {
            c = '?';
        }
    }
    return name;
}

std::optional<std::string> readName(const std::string& path) {
    std::string text;
    if (readFile(path, text, kSmallFileBytes) != 0) {
        return std::nullopt;
    }
    const auto eol = text.find('\n');
    std::string name = cleanName(std::string_view(text).substr(0, eol));
    if (name.empty()) {
        return std::nullopt;
    }
    return name;
}

std::string lower(std::string_view s) {
    std::string out(s);
    std::transform(out.begin(), out.end(), out.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return out;
}

bool containsAny(const std::string& haystack, std::initializer_list<std::string_view> needles) {
    return std::any_of(needles.begin(), needles.end(),
                       [&](std::string_view n) { return haystack.find(n) != std::string::npos; });
}

// Orders "cpu2" before "cpu10": runs of digits compare as numbers.
bool naturalLess(const std::string& a, const std::string& b) {
    std::size_t i = 0, j = 0;
    while (i < a.size() && j < b.size()) {
        const bool da = std::isdigit(static_cast<unsigned char>(a[i]));
        const bool db = std::isdigit(static_cast<unsigned char>(b[j]));
        if (da && db) {
            std::size_t ei = i, ej = j;
            while (ei < a.size() && std::isdigit(static_cast<unsigned char>(a[ei])))
                ++ei;
            while (ej < b.size() && std::isdigit(static_cast<unsigned char>(b[ej])))
                ++ej;
            std::string_view na(a.data() + i, ei - i), nb(b.data() + j, ej - j);
            while (na.size() > 1 && na.front() == '0')
                na.remove_prefix(1);
            while (nb.size() > 1 && nb.front() == '0')
                nb.remove_prefix(1);
            if (na.size() != nb.size()) {
                return na.size() < nb.size();
            }
            if (na != nb) {
                return na < nb;
            }
            i = ei;
            j = ej;
            continue;
        }
        if (a[i] != b[j]) {
            return a[i] < b[j];
        }
        ++i;
        ++j;
    }
    return a.size() - i < b.size() - j;
}

std::vector<std::string> allEntries(const std::string& dir) {
    std::vector<std::string> names;
    DIR* d = ::opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    while (const dirent* e = ::readdir(d)) {
        const std::string_view name = e->d_name;
        if (name != "." && name != "..") {
            names.emplace_back(name);
        }
    }
    ::closedir(d);
    std::sort(names.begin(), names.end(), naturalLess);
    return names;
}

// Entries of a directory whose names start with prefix followed by digits only, in natural
// order; empty when the directory cannot be read.
std::vector<std::string> numberedEntries(const std::string& dir, std::string_view prefix) {
    std::vector<std::string> names = allEntries(dir);
    std::erase_if(names, [&](const std::string& name) {
        return name.size() <= prefix.size() || !name.starts_with(prefix) ||
               !std::all_of(name.begin() + static_cast<std::ptrdiff_t>(prefix.size()), name.end(),
                            [](unsigned char c) { return std::isdigit(c); });
    });
    return names;
}

bool exists(const std::string& path) {
    return ::access(path.c_str(), F_OK) == 0;
}

int readInterrupts(const std::string& path, std::map<unsigned, InterruptLine>& lines,
                   bool wantActions) {
    std::string text;
    text.reserve(16 * 1024);
    if (const int error = readFile(path, text, kLargeFileBytes)) {
        return error;
    }
    std::string_view rest = text;
    std::size_t cpus = 0;
    bool header = true;
    while (!rest.empty()) {
        const std::size_t eol = rest.find('\n');
        std::string_view line = rest.substr(0, eol);
        rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 1);
        if (header) {
            // "CPU0 CPU1 ...": one count column per CPU.
            header = false;
            std::size_t at = 0;
            while ((at = line.find("CPU", at)) != std::string_view::npos) {
                ++cpus;
                at += 3;
            }
            continue;
        }
        line = trim(line);
        const std::size_t colon = line.find(':');
        if (colon == std::string_view::npos) {
            continue;
        }
        unsigned irq = 0;
        const auto [end, ec] = std::from_chars(line.data(), line.data() + colon, irq);
        if (ec != std::errc() || end != line.data() + colon) {
            continue;  // NMI, LOC and the other per-CPU rows have names, not numbers
        }
        std::string_view tail = line.substr(colon + 1);
        std::uint64_t sum = 0;
        for (std::size_t c = 0; c < cpus; ++c) {
            tail = trim(tail);
            std::uint64_t v = 0;
            const auto [p, e] = std::from_chars(tail.data(), tail.data() + tail.size(), v);
            if (e != std::errc() || (p != tail.data() + tail.size() && *p != ' ')) {
                break;
            }
            sum += v;
            tail.remove_prefix(static_cast<std::size_t>(p - tail.data()));
        }
        InterruptLine& entry = lines[irq];
        entry.count = sum;
        if (wantActions) {
            // The kernel prints chip, hardware IRQ and type, then two blanks and the actions.
            tail = trim(tail);
            const std::size_t gap = tail.rfind("  ");
            entry.actions = cleanName(gap == std::string_view::npos ? std::string_view()
                                                                    : tail.substr(gap + 2));
        }
    }
    return 0;
}

}  // namespace qv::kernelfiles
