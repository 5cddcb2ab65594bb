#pragma once

// Expected reports are files under tests/data/reports/ (see the README
// there). With HEFT_UPDATE_REPORTS=1 every report a test compares is
// written back from what heft prints now, and the diff of tests/data/
// shows what changed.

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>

inline void expectReport(const std::string& name, const std::string& actual)
{
    const std::string path = std::string(HEFT_TEST_DATA_DIR) + "/reports/" + name;
    const char* update = std::getenv("HEFT_UPDATE_REPORTS");
    if (update && *update && std::string(update) != "0") {
        std::ofstream(path, std::ios::binary) << actual;
        return;
    }
    std::stringstream expected;
    expected << std::ifstream(path, std::ios::binary).rdbuf();
    EXPECT_EQ(actual, expected.str()) << "differs from " << path << "; HEFT_UPDATE_REPORTS=1 rewrites it";
}
