#include <gtest/gtest.h>

#include <cstdio>
#include <fstream>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <sys/wait.h>

namespace {

std::string contentsOf(const std::string& path)
{
    std::ifstream file(path);
    std::ostringstream text;
    text << file.rdbuf();
    return text.str();
}

// The "-x" and "--long" options a text names; not the hyphen inside a word
// ("idle-exit") nor a bare "--".
std::set<std::string> optionsIn(const std::string& text)
{
    static const std::regex option(R"((^|[^A-Za-z0-9-])(--?[A-Za-z][A-Za-z0-9-]*))");
    std::set<std::string> options;
    for (std::sregex_iterator it(text.begin(), text.end(), option), end; it != end; ++it) options.insert((*it)[2]);
    return options;
}

}  // namespace

TEST(HTManualPageTest, DescribesEveryOptionOfTheUsage)
{
    const std::set<std::string> usage = optionsIn(contentsOf(std::string(HEFT_TEST_DATA_DIR) + "/usage.txt"));
    ASSERT_TRUE(usage.count("-a") && usage.count("--snapshot-dir")) << "the usage text was not read";
    // The page as a reader sees it: "\-" is a hyphen, and font changes go.
    std::string page = std::regex_replace(contentsOf(HEFT_MANUAL_PAGE), std::regex(R"(\\-)"), "-");
    page = std::regex_replace(page, std::regex(R"(\\f(\[[^\]]*\]|\(..|.))"), "");
    const std::set<std::string> described = optionsIn(page);
    for (const std::string& option : usage) EXPECT_TRUE(described.count(option)) << option << " is not in heft.1";
}

TEST(HTManualPageTest, FormatsWithoutWarnings)
{
    FILE* groff = popen("groff -ww -z -man '" HEFT_MANUAL_PAGE "' 2>&1", "r");
    ASSERT_NE(groff, nullptr);
    std::string said;
    char buffer[512];
    while (size_t count = std::fread(buffer, 1, sizeof(buffer), groff)) said.append(buffer, count);
    const int status = pclose(groff);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "groff (package groff-base) failed: " << said;
    EXPECT_EQ(said, "");
}
