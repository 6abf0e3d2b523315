// MIME types of file names: HTTPFileOutputer::GetMimeType. The table is
// /etc/mime.types (under the system root), in the format of the
// media-types package: one media type per line followed by zero or more
// extensions, separated by blanks; "#" starts a comment line.
#include <cctype>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <string>
#include <unordered_map>

#include "system/FileUtil.h"
#include "vela/httpoutput.h"
#include "vela/log.h"
#include "vela/vlibc.h"

namespace {

const char kMimeTypesPath[] = "/etc/mime.types";
const char kDefaultType[] = "application/octet-stream";
// Debian's file is about 75 KB; a file far larger than that is not ours.
constexpr size_t kMaxMimeTypesFile = 4 * 1024 * 1024;
constexpr size_t kMaxType = 255;
constexpr size_t kMaxExtension = 64;

// Used when the system file is missing or unreadable.
const char* const kBuiltIn[][2] = {
    {"html", "text/html"},          {"htm", "text/html"},
    {"txt", "text/plain"},          {"log", "text/plain"},
    {"css", "text/css"},            {"csv", "text/csv"},
    {"js", "text/javascript"},      {"json", "application/json"},
    {"xml", "application/xml"},     {"pdf", "application/pdf"},
    {"zip", "application/zip"},     {"gz", "application/gzip"},
    {"tgz", "application/gzip"},    {"tar", "application/x-tar"},
    {"7z", "application/x-7z-compressed"},
    {"png", "image/png"},           {"jpg", "image/jpeg"},
    {"jpeg", "image/jpeg"},         {"gif", "image/gif"},
    {"webp", "image/webp"},         {"svg", "image/svg+xml"},
    {"ico", "image/vnd.microsoft.icon"},
    {"bmp", "image/bmp"},           {"tif", "image/tiff"},
    {"tiff", "image/tiff"},         {"mp3", "audio/mpeg"},
    {"wav", "audio/x-wav"},         {"flac", "audio/flac"},
    {"ogg", "audio/ogg"},           {"mp4", "video/mp4"},
    {"m4v", "video/mp4"},           {"mkv", "video/x-matroska"},
    {"webm", "video/webm"},         {"avi", "video/x-msvideo"},
    {"mov", "video/quicktime"},
};

using MimeTable = std::unordered_map<std::string, std::string>;

bool IsBlank(char c) { return c == ' ' || c == '\t' || c == '\r'; }

std::string LowerAscii(std::string text)
{
    for (char& c : text) {
        if (c >= 'A' && c <= 'Z') {
            c = static_cast<char>(c - 'A' + 'a');
        }
    }
    return text;
}

// A media type "type/subtype[;params]" of printable ASCII without blanks.
bool ValidType(const std::string& type)
{
    if (type.empty() || type.size() > kMaxType || type.find('/') == std::string::npos) {
        return false;
    }
    for (unsigned char c : type) {
        if (c <= 0x20 || c >= 0x7f) {
            return false;
        }
    }
    return true;
}

bool ValidExtension(const std::string& ext)
{
    if (ext.empty() || ext.size() > kMaxExtension) {
        return false;
    }
    for (unsigned char c : ext) {
        if (c <= 0x20 || c >= 0x7f || c == '/') {
            return false;
        }
    }
    return true;
}

// Fills `table` from the text of a mime.types file. The first type listed
// for an extension wins; malformed words are skipped.
void ParseMimeTypes(const std::string& text, MimeTable& table)
{
    size_t pos = 0;
    while (pos < text.size()) {
        size_t end = text.find('\n', pos);
        if (end == std::string::npos) {
            end = text.size();
        }
        size_t i = pos;
        pos = end + 1;
        while (i < end && IsBlank(text[i])) {
            ++i;
        }
        if (i == end || text[i] == '#') {
            continue;
        }
        std::string type;
        bool first = true;
        while (i < end) {
            size_t wordEnd = i;
            while (wordEnd < end && !IsBlank(text[wordEnd])) {
                ++wordEnd;
            }
            const std::string word = text.substr(i, wordEnd - i);
            i = wordEnd;
            while (i < end && IsBlank(text[i])) {
                ++i;
            }
            if (first) {
                first = false;
                if (!ValidType(word)) {
                    break;
                }
                type = word;
            } else if (ValidExtension(word)) {
                table.emplace(LowerAscii(word), type);
            }
        }
    }
}

void FillBuiltIn(MimeTable& table)
{
    for (const auto& entry : kBuiltIn) {
        table.emplace(entry[0], entry[1]);
    }
}

// The table of the current root's file. It is read on first use and read
// again only when the system root changes (tests switch roots).
class MimeTypes {
public:
    std::string Lookup(const std::string& ext)
    {
        std::lock_guard<std::mutex> guard(lock_);
        const std::string path = VELA::System::Path(kMimeTypesPath);
        if (!loaded_ || path != path_) {
            Load(path);
        }
        const auto it = table_.find(ext);
        return it == table_.end() ? kDefaultType : it->second;
    }

private:
    void Load(const std::string& path)
    {
        MimeTable table;
        std::string text;
        int err = 0;
        if (VELA::System::ReadFileBounded(path, kMaxMimeTypesFile, text, err)) {
            ParseMimeTypes(text, table);
        } else {
            if (err != ENOENT) {
                VELA_LOG_ERR("cannot read %s: %s; using the built-in MIME types", path.c_str(), strerror(err));
            }
            FillBuiltIn(table);
        }
        table_.swap(table);
        path_ = path;
        loaded_ = true;
    }

    std::mutex lock_;
    MimeTable table_;
    std::string path_;
    bool loaded_ = false;
};

MimeTypes& Table()
{
    static MimeTypes* table = new MimeTypes();  // never destroyed: usable until exit
    return *table;
}

}  // namespace

std::string HTTPFileOutputer::GetMimeType(const std::string& name)
{
    try {
        const size_t slash = name.rfind('/');
        const size_t base = slash == std::string::npos ? 0 : slash + 1;
        const size_t dot = name.rfind('.');
        if (dot == std::string::npos || dot < base || dot + 1 >= name.size()) {
            return kDefaultType;
        }
        const std::string ext = LowerAscii(name.substr(dot + 1));
        if (!ValidExtension(ext)) {
            return kDefaultType;
        }
        return Table().Lookup(ext);
    } catch (const std::exception&) {
        return kDefaultType;
    }
}
