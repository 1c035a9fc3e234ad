#pragma once

#include <array>
#include <cstdint>
#include <filesystem>
#include <string>
#include <string_view>

#include "Result.h"
#include "recordset/Value.h"

namespace kest {

// The service's secret pepper, with the cost of the password hash. Kept in a
// key file of its own (mode 0600), never in the database.
struct KeyMaterial {
    std::array<unsigned char, 32> pepper{};
    // About 25 ms per code on the development machine: a logon stays quick,
    // guessing stays expensive.
    uint64_t opsLimit = 3;             // Argon2id passes
    std::size_t memLimit = 16u << 20;  // bytes
};

// Creates a new key file with a fresh random pepper; refuses to overwrite.
Result<KeyMaterial> createKeyFile(const std::filesystem::path& file);
// Reads a key file; a missing, unreadable or malformed one is err::kKeyFile.
Result<KeyMaterial> loadKeyFile(const std::filesystem::path& file);

// The form in which passwords are compared and coded: blanks trimmed, lower case.
std::string normalisePassword(std::string_view password);

// The stored code of a password: a whole number in [1, 2^52), held exactly in
// a double, from Argon2id over the normalised password with a salt derived from
// the pepper and the change moment rounded to the second. 0 is never returned
// (it stands for a blank password).
Result<double> passwordCode(const KeyMaterial& key, std::string_view password, Date moment);

}  // namespace kest
