#pragma once

#include <filesystem>
#include <string>

#include "Result.h"

namespace kest {

struct InitOptions {
    std::filesystem::path dataDir;
    std::string dsn;
    std::string adminName;
    std::string password;  // read by the caller from standard input
    bool demo = false;     // add realistic sample data, every demo user with `password`
};

// Creates a data source: the database with the current schema, the key file,
// the entry in the data-sources file, the nine lookup lists in
// "AdministerTables" and user 1, the administrator, with Security 8. Refuses a
// data source name that already exists.
Status initDataSource(const InitOptions& options);

}  // namespace kest
