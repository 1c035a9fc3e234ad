#include "service/DataSources.h"
#include "recordset/AsciiText.h"

#include <fcntl.h>
#include <pwd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <system_error>

#include "service/Errors.h"

namespace kest {

namespace {

std::string_view trim(std::string_view s) {
    while (!s.empty() && (s.front() == ' ' || s.front() == '\t' || s.front() == '\r'))
        s.remove_prefix(1);
    while (!s.empty() && (s.back() == ' ' || s.back() == '\t' || s.back() == '\r'))
        s.remove_suffix(1);
    return s;
}

std::filesystem::path configFile(const std::filesystem::path& dataDir) {
    return dataDir / std::string(kDataSourcesFile);
}

Error malformed(const std::filesystem::path& file, int line, const std::string& why) {
    return Error{err::kStorage, "the data-sources file " + file.string() +
                                    " is malformed at line " + std::to_string(line) + ": " + why};
}

// The file's lines; a missing file has none.
Result<std::vector<std::string>> readLines(const std::filesystem::path& file) {
    std::error_code ec;
    if (!std::filesystem::exists(file, ec))
        return std::vector<std::string>{};
    std::ifstream in(file, std::ios::binary);
    if (!in)
        return Error{err::kStorage, "cannot read the data-sources file " + file.string()};
    std::vector<std::string> lines;
    std::string line;
    while (std::getline(in, line))
        lines.push_back(line);
    if (in.bad())
        return Error{err::kStorage, "cannot read the data-sources file " + file.string()};
    return lines;
}

bool isSectionHeader(std::string_view line) {
    line = trim(line);
    return !line.empty() && line.front() == '[';
}

Result<std::vector<DataSourceConfig>> parse(const std::filesystem::path& file,
                                            const std::vector<std::string>& lines) {
    std::vector<DataSourceConfig> sources;
    std::vector<int> headerLine;
    for (std::size_t i = 0; i < lines.size(); ++i) {
        int number = static_cast<int>(i) + 1;
        std::string_view line = trim(lines[i]);
        if (line.empty() || line.front() == '#' || line.front() == ';')
            continue;
        if (line.front() == '[') {
            if (line.back() != ']')
                return malformed(file, number, "a section header lacks its closing ']'");
            std::string name(trim(line.substr(1, line.size() - 2)));
            if (!validDataSourceName(name))
                return malformed(file, number, "\"" + name + "\" is not a valid data-source name");
            for (const DataSourceConfig& known : sources) {
                if (asciiLower(known.name) == asciiLower(name))
                    return malformed(file, number, "the data source " + name + " appears twice");
            }
            sources.push_back(DataSourceConfig{name, "", "", ""});
            headerLine.push_back(number);
            continue;
        }
        std::size_t eq = line.find('=');
        if (eq == std::string_view::npos)
            return malformed(file, number, "expected \"key = value\"");
        if (sources.empty())
            return malformed(file, number, "a setting comes before the first [section]");
        std::string key = asciiLower(trim(line.substr(0, eq)));
        std::string value(trim(line.substr(eq + 1)));
        DataSourceConfig& current = sources.back();
        std::string* slot = nullptr;
        if (key == "driver")
            slot = &current.driver;
        else if (key == "database")
            slot = &current.database;
        else if (key == "keyfile")
            slot = &current.keyFile;
        else
            return malformed(file, number, "unknown setting \"" + key + "\"");
        if (!slot->empty())
            return malformed(file, number, "the setting \"" + key + "\" appears twice");
        if (value.empty())
            return malformed(file, number, "the setting \"" + key + "\" is empty");
        *slot = key == "driver" ? asciiLower(value) : value;
    }
    for (std::size_t i = 0; i < sources.size(); ++i) {
        DataSourceConfig& s = sources[i];
        if (s.driver.empty())
            s.driver = "sqlite";
        if (s.database.empty())
            return malformed(file, headerLine[i], "the data source " + s.name + " has no database");
        if (s.keyFile.empty())
            return malformed(file, headerLine[i], "the data source " + s.name + " has no keyfile");
    }
    return sources;
}

bool hasLineBreak(const std::string& s) {
    return s.find('\n') != std::string::npos || s.find('\r') != std::string::npos;
}

Status writeAtomically(const std::filesystem::path& file, const std::string& text) {
    std::filesystem::path temp = file;
    temp += ".tmp." + std::to_string(getpid());
    int fd = ::open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) {
        return Error{err::kStorage, "cannot write " + temp.string() + ": " + std::strerror(errno)};
    }
    const char* p = text.data();
    std::size_t left = text.size();
    bool good = true;
    while (left > 0) {
        ssize_t n = ::write(fd, p, left);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            good = false;
            break;
        }
        p += n;
        left -= static_cast<std::size_t>(n);
    }
    std::string why = good ? "" : std::strerror(errno);
    if (good && ::fsync(fd) != 0) {
        good = false;
        why = std::strerror(errno);
    }
    ::close(fd);
    if (good && std::rename(temp.c_str(), file.c_str()) != 0) {
        good = false;
        why = std::strerror(errno);
    }
    if (!good) {
        std::error_code ignored;
        std::filesystem::remove(temp, ignored);
        return Error{err::kStorage, "cannot write " + file.string() + ": " + why};
    }
    return okStatus();
}

}  // namespace

bool validDataSourceName(std::string_view name) {
    if (name.empty() || name.size() > 64)
        return false;
    for (char c : name) {
        bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                  c == '_' || c == '-' || c == '.' || c == ' ';
        if (!ok)
            return false;
    }
    // Blanks at either end would be lost in the file, and "." or ".." would
    // make odd file names.
    if (name.front() == ' ' || name.back() == ' ')
        return false;
    return name != "." && name != "..";
}

Result<std::vector<DataSourceConfig>> loadDataSources(const std::filesystem::path& dataDir) {
    std::filesystem::path file = configFile(dataDir);
    auto lines = readLines(file);
    if (!lines.ok())
        return lines.error();
    return parse(file, lines.value());
}

Result<DataSourceConfig> findDataSource(const std::filesystem::path& dataDir,
                                        std::string_view name) {
    auto sources = loadDataSources(dataDir);
    if (!sources.ok())
        return sources.error();
    std::string wanted = asciiLower(name);
    for (const DataSourceConfig& s : sources.value()) {
        if (asciiLower(s.name) == wanted)
            return s;
    }
    return Error{err::kUnknownDataSource, "the data source \"" + std::string(name) +
                                              "\" is not configured in " +
                                              configFile(dataDir).string()};
}

Status saveDataSource(const std::filesystem::path& dataDir, const DataSourceConfig& config) {
    if (!validDataSourceName(config.name))
        return Error{err::kBadArgument, "\"" + config.name + "\" is not a valid data-source name"};
    if (config.driver.empty() || config.database.empty() || config.keyFile.empty() ||
        hasLineBreak(config.driver) || hasLineBreak(config.database) ||
        hasLineBreak(config.keyFile) || trim(config.database) != config.database ||
        trim(config.keyFile) != config.keyFile || trim(config.driver) != config.driver)
        return Error{err::kBadArgument, "the data source " + config.name +
                                            " needs a driver, a database and a keyfile"};
    std::filesystem::path file = configFile(dataDir);
    std::error_code ec;
    std::filesystem::create_directories(dataDir, ec);
    if (ec)
        return Error{err::kStorage, "cannot create " + dataDir.string() + ": " + ec.message()};
    auto lines = readLines(file);
    if (!lines.ok())
        return lines.error();
    // Refuse to rewrite a file we cannot read: its other entries would be lost.
    auto parsed = parse(file, lines.value());
    if (!parsed.ok())
        return parsed.error();

    // Keep every other line as it was, comments included; the entry's own
    // section goes and the new one is appended.
    std::string wanted = asciiLower(config.name);
    std::ostringstream out;
    bool skipping = false;
    for (const std::string& line : lines.value()) {
        if (isSectionHeader(line)) {
            std::string_view t = trim(line);
            skipping = asciiLower(trim(t.substr(1, t.size() - 2))) == wanted;
        }
        if (!skipping)
            out << line << '\n';
    }
    std::string text = out.str();
    if (!text.empty() && !text.ends_with("\n\n"))
        text += '\n';
    text += "[" + config.name + "]\n";
    text += "driver = " + config.driver + "\n";
    text += "database = " + config.database + "\n";
    text += "keyfile = " + config.keyFile + "\n";
    return writeAtomically(file, text);
}

std::filesystem::path resolvePath(const std::filesystem::path& dataDir, const std::string& path) {
    std::filesystem::path p(path);
    if (p.is_absolute())
        return p;
    return dataDir / p;
}

std::filesystem::path defaultDataDir() {
    if (const char* dir = std::getenv("KESTLOGON_DATA_DIR"); dir != nullptr && *dir != '\0')
        return dir;
    if (const char* xdg = std::getenv("XDG_DATA_HOME");
        xdg != nullptr && *xdg != '\0' && std::filesystem::path(xdg).is_absolute())
        return std::filesystem::path(xdg) / "kestlogon";
    const char* home = std::getenv("HOME");
    if (home == nullptr || *home == '\0') {
        if (const passwd* pw = getpwuid(getuid()); pw != nullptr && pw->pw_dir != nullptr)
            home = pw->pw_dir;
    }
    std::filesystem::path base = home != nullptr ? home : ".";
    return base / ".local" / "share" / "kestlogon";
}

}  // namespace kest
