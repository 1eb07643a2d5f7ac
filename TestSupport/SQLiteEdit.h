// Changes of stored files behind the back of the code under test.
#pragma once

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <string>
#include <string_view>

#include "TestSupport/TemporaryStateDirectory.h"

namespace platform {

/// Runs SQL on a file of the state directory as any other program could.
inline void editDatabase(std::string_view file, const std::string& sql) {
    sqlite3* database = nullptr;
    EXPECT_EQ(sqlite3_open(TemporaryStateDirectory::file(file).c_str(), &database), SQLITE_OK);
    sqlite3_busy_timeout(database, 1000);
    EXPECT_EQ(sqlite3_exec(database, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
        << sql << ": " << sqlite3_errmsg(database);
    sqlite3_close(database);
}

}  // namespace platform
