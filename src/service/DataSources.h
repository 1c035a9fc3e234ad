#pragma once

#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

#include "Result.h"

namespace kest {

// One entry of the service's data-sources file: a name the callers pass as
// DBused, mapped to a driver and a location.
//
// The file (DATA_DIR/datasources.conf) holds one section per data source:
//   [Demo]
//   driver = sqlite
//   database = demo.db        (relative paths are relative to the data folder)
//   keyfile = demo.key
// Lines starting with '#' or ';' are comments.
struct DataSourceConfig {
    std::string name;
    std::string driver;    // "sqlite" (later "postgresql")
    std::string database;  // a file for sqlite
    std::string keyFile;   // the pepper's key file
};

constexpr std::string_view kDataSourcesFile = "datasources.conf";

// A name may hold letters, digits, '_', '-', '.' and blanks, 1 to 64 characters.
bool validDataSourceName(std::string_view name);

Result<std::vector<DataSourceConfig>> loadDataSources(const std::filesystem::path& dataDir);
// The entry of that name ignoring letter case; err::kUnknownDataSource when
// there is none (never a new empty database).
Result<DataSourceConfig> findDataSource(const std::filesystem::path& dataDir,
                                        std::string_view name);
// Adds or replaces an entry, writing the file atomically.
Status saveDataSource(const std::filesystem::path& dataDir, const DataSourceConfig& config);
// A path from the file made absolute against the data folder.
std::filesystem::path resolvePath(const std::filesystem::path& dataDir, const std::string& path);

// The user's data folder the embedded default uses: $KESTLOGON_DATA_DIR when
// set, else $XDG_DATA_HOME/kestlogon, else ~/.local/share/kestlogon.
std::filesystem::path defaultDataDir();

}  // namespace kest
