#include "platform/linux/HTPageDisposition.h"
#include "platform/HTPlatformTypes.h"

#include <gtest/gtest.h>

#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

namespace {

constexpr uint64_t kFrame = 0x1234;
constexpr uint64_t kPresentEntry = HT_PAGEMAP_PRESENT | kFrame;
constexpr uint64_t kFileEntry = HT_PAGEMAP_PRESENT | HT_PAGEMAP_FILE_OR_SHARED | kFrame;
// A swapped page's entry holds the swap type and offset where a frame number would be.
constexpr uint64_t kSwappedEntry = HT_PAGEMAP_SWAPPED | 0x5678;
constexpr uint64_t kNoFlags = ~uint64_t{0};  // the page flags could not be read

int32_t withFlags(uint64_t entry, uint64_t flags, HTPageMapping mapping)
{
    return htPageDisposition(entry, flags == kNoFlags ? nullptr : &flags, mapping);
}

// The names of data/page-dispositions.txt, joined by '|'.
uint64_t bits(const std::string& text, const std::map<std::string, uint64_t>& names)
{
    uint64_t result = 0;
    std::istringstream parts(text);
    for (std::string part; std::getline(parts, part, '|');) result |= part == "0" ? 0 : names.at(part);
    return result;
}

const std::map<std::string, uint64_t> kEntries = {
    {"resident", kPresentEntry},         {"file", kFileEntry},
    {"swapped", kSwappedEntry},          {"bare", HT_PAGEMAP_PRESENT},
    {"exclusive", HT_PAGEMAP_EXCLUSIVE}, {"guard", HT_PAGEMAP_GUARD_REGION}};
const std::map<std::string, uint64_t> kFlags = {{"anon", HT_KPF_ANON},
                                                {"swapbacked", HT_KPF_SWAPBACKED},
                                                {"dirty", HT_KPF_DIRTY},
                                                {"unread", kNoFlags}};
const std::map<std::string, uint64_t> kAnswers = {
    {"present", VM_PAGE_QUERY_PAGE_PRESENT},     {"dirty", VM_PAGE_QUERY_PAGE_DIRTY},
    {"paged-out", VM_PAGE_QUERY_PAGE_PAGED_OUT}, {"external", VM_PAGE_QUERY_PAGE_EXTERNAL},
    {"reusable", VM_PAGE_QUERY_PAGE_REUSABLE},   {"copied", VM_PAGE_QUERY_PAGE_COPIED}};
// HTPageMapping: sharedMemory, hugetlb, cleanFile, plainAnonymous, privateFile.
const std::map<std::string, HTPageMapping> kMappings = {{"private", {}},
                                                        {"shm", {true, false}},
                                                        {"hugetlb", {false, true}},
                                                        {"clean-file", {false, false, true, false}},
                                                        {"plain-anon", {false, false, false, true}},
                                                        {"private-file", {false, false, false, false, true}}};

}  // namespace

TEST(HTPageDisposition, AnswersFlagsAndIdentitiesOfTheDataFile)
{
    std::ifstream file(HEFT_TEST_DATA_DIR "/page-dispositions.txt");
    int rows = 0;
    for (std::string line; std::getline(file, line);) {
        if (line.empty() || line[0] == '#') continue;
        SCOPED_TRACE(line);
        ++rows;
        std::istringstream words(line);
        std::vector<std::string> word;
        for (std::string next; words >> next && next != "=>";) word.push_back(next);
        std::string expected;
        words >> expected;
        if (word[0] == "skip-safe") {
            std::istringstream entries(word.at(1));
            const HTPageMapping mapping = kMappings.at(word.at(2));
            for (std::string name; std::getline(entries, name, ',');) {
                const uint64_t entry = bits(name, kEntries);
                if (htPageFlagsMatter(entry, mapping)) continue;
                for (size_t flags = 3; flags < word.size(); ++flags)
                    EXPECT_EQ(withFlags(entry, bits(word[flags], kFlags), mapping), withFlags(entry, kNoFlags, mapping))
                        << name << " " << word[flags];
            }
            continue;
        }
        const uint64_t entry = bits(word.at(1), kEntries);
        if (word[0] == "disposition") {
            EXPECT_EQ(withFlags(entry, bits(word.at(2), kFlags), kMappings.at(word.at(3))), bits(expected, kAnswers));
        } else if (word[0] == "flags-matter") {
            EXPECT_EQ(htPageFlagsMatter(entry, kMappings.at(word.at(2))), expected == "yes");
        } else {
            const uint64_t identity = htSharedPageIdentity(entry, word.at(2) == "yes", word.at(3) == "yes");
            EXPECT_EQ(identity != 0, expected == "named");
            EXPECT_LT(identity, HTMaxPageIdentity);
        }
    }
    EXPECT_EQ(rows, 40);
    EXPECT_EQ(htPagemapFrame(kSwappedEntry), 0u);
    EXPECT_EQ(htPagemapFrame(kFileEntry), kFrame);
    // A frame and a swap slot of the same number are different pages; the
    // same frame seen from two processes is one.
    EXPECT_NE(htSharedPageIdentity(HT_PAGEMAP_PRESENT | 0x5678, false, false),
              htSharedPageIdentity(kSwappedEntry, true, false));
    EXPECT_EQ(htSharedPageIdentity(kPresentEntry, false, false), htSharedPageIdentity(kPresentEntry, true, false));
}
