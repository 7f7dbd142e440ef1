#include "workers/diagnostics/QVReportingPropertyListFile.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>

#include <fmt/format.h>

namespace qv {

namespace {

// Seconds from 1970-01-01 to 2001-01-01, the epoch of property-list dates.
constexpr double kPlistEpochSince1970 = 978307200.0;

struct PlistFree {
    void operator()(void* node) const { plist_free(static_cast<plist_t>(node)); }
};
struct MallocFree {
    void operator()(void* p) const { std::free(p); }
};

// The deepest nesting of <dict> and <array> in the text; an element written empty ("<dict/>")
// opens nothing.
std::size_t nestingDepth(const std::string& xml) {
    std::size_t depth = 0;
    std::size_t deepest = 0;
    for (std::size_t at = xml.find('<'); at != std::string::npos; at = xml.find('<', at + 1)) {
        const std::string_view tag(xml.data() + at, std::min<std::size_t>(8, xml.size() - at));
        if (tag.starts_with("<dict") || tag.starts_with("<array")) {
            const auto close = xml.find('>', at);
            if (close != std::string::npos && xml[close - 1] != '/') {
                deepest = std::max(deepest, ++depth);
            }
        } else if ((tag.starts_with("</dict") || tag.starts_with("</array")) && depth > 0) {
            --depth;
        }
    }
    return deepest;
}

Value toValue(plist_t node) {
    switch (plist_get_node_type(node)) {
        case PLIST_BOOLEAN: {
            std::uint8_t b = 0;
            plist_get_bool_val(node, &b);
            return Value(b != 0);
        }
        case PLIST_UINT: {
            std::uint64_t u = 0;
            plist_get_uint_val(node, &u);
            // The library keeps one integer kind; written negative numbers come back in two's
            // complement, so small ones are read as signed.
            return Value(static_cast<std::int64_t>(u));
        }
        case PLIST_REAL: {
            double d = 0;
            plist_get_real_val(node, &d);
            return Value(d);
        }
        case PLIST_STRING:
        case PLIST_KEY: {
            char* text = nullptr;
            plist_get_string_val(node, &text);
            std::unique_ptr<char, MallocFree> owned(text);
            return Value(std::string(text ? text : ""));
        }
        case PLIST_DATE: {
            std::int32_t sec = 0;
            std::int32_t usec = 0;
            plist_get_date_val(node, &sec, &usec);
            return Value(Date{kPlistEpochSince1970 + sec + usec / 1e6});
        }
        case PLIST_DATA: {
            char* data = nullptr;
            std::uint64_t length = 0;
            plist_get_data_val(node, &data, &length);
            std::unique_ptr<char, MallocFree> owned(data);
            return Value(Bytes(data, data + length));
        }
        case PLIST_ARRAY: {
            Array array;
            const std::uint32_t n = plist_array_get_size(node);
            array.reserve(n);
            for (std::uint32_t i = 0; i < n; ++i) {
                array.push_back(toValue(plist_array_get_item(node, i)));
            }
            return Value(std::move(array));
        }
        case PLIST_DICT: {
            Dictionary dictionary;
            plist_dict_iter iter = nullptr;
            plist_dict_new_iter(node, &iter);
            std::unique_ptr<void, MallocFree> ownedIter(iter);
            for (;;) {
                char* key = nullptr;
                plist_t item = nullptr;
                plist_dict_next_item(node, iter, &key, &item);
                std::unique_ptr<char, MallocFree> ownedKey(key);
                if (!item) {
                    break;
                }
                dictionary.set(key ? key : "", toValue(item));
            }
            return Value(std::move(dictionary));
        }
        default:
            return Value();
    }
}

}  // namespace

QVReportingPropertyList QVReportingReadXMLPropertyList(const std::string& xml) {
    if (xml.size() > QVReportingPropertyList::kMaxBytes) {
        return {std::nullopt, fmt::format("the property list is larger than {} bytes",
                                          QVReportingPropertyList::kMaxBytes)};
    }
    if (xml.find("<plist") == std::string::npos) {
        return {std::nullopt, "not a property list in the XML format"};
    }
    if (nestingDepth(xml) > QVReportingPropertyList::kMaxDepth) {
        return {std::nullopt, fmt::format("the property list is nested more than {} deep",
                                          QVReportingPropertyList::kMaxDepth)};
    }
    plist_t node = nullptr;
    plist_from_xml(xml.data(), static_cast<std::uint32_t>(xml.size()), &node);
    std::unique_ptr<void, PlistFree> owned(node);
    if (!node) {
        return {std::nullopt, "the text is not a valid XML property list"};
    }
    return {toValue(node), {}};
}

QVReportingPropertyList QVReportingReadXMLPropertyListFile(const std::filesystem::path& path) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) {
        return {std::nullopt, fmt::format("cannot open the file: {}", std::strerror(errno))};
    }
    struct stat st {};
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        ::close(fd);
        return {std::nullopt, "not a regular file"};
    }
    std::string xml;
    char buffer[65536];
    int error = 0;
    for (;;) {
        const ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            error = errno;
            break;
        }
        if (n == 0) {
            break;
        }
        if (xml.size() + static_cast<std::size_t>(n) > QVReportingPropertyList::kMaxBytes) {
            ::close(fd);
            return {std::nullopt, fmt::format("the file is larger than {} bytes",
                                              QVReportingPropertyList::kMaxBytes)};
        }
        xml.append(buffer, static_cast<std::size_t>(n));
    }
    ::close(fd);
    if (error != 0) {
        return {std::nullopt, fmt::format("cannot read the file: {}", std::strerror(error))};
    }
    return QVReportingReadXMLPropertyList(xml);
}

}  // namespace qv
