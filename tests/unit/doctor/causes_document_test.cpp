#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <string>

#include "doctor/causes.h"

namespace pelorus::doctor {
namespace {

// The rows of the table in docs/doctor.md, without their last cell: when the cause is named is told
// there in the page's own words.
std::string documentedCauses() {
    std::ifstream file{PELORUS_SOURCES "/../docs/doctor.md"};
    std::string line, rows;
    while (std::getline(file, line) && line != "## Causes") continue;
    while (std::getline(file, line) && line.find("| ---") != 0) continue;
    while (std::getline(file, line) && !line.empty()) {
        rows += line.substr(0, line.rfind(" | ") + 2) + "\n";
    }
    return rows;
}

// The cause in each row of the table that scripts/diagnoses writes.
std::set<std::string> shownCauses() {
    std::ifstream file{PELORUS_SOURCES "/../docs/doctor.md"};
    std::string line;
    std::set<std::string> names;
    while (std::getline(file, line) && line != "<!-- diagnoses -->") continue;
    while (std::getline(file, line) && line != "<!-- end -->") {
        const std::size_t begin = line.find("| `");
        if (begin == line.npos) continue;
        names.insert(line.substr(begin + 3, line.find('`', begin + 3) - begin - 3));
    }
    return names;
}

TEST(CausesDocument, SaysForEachCauseWhichScenarioShowsIt) {
    const std::set<std::string> shown = shownCauses();
    for (const Cause& cause : allCauses())
        EXPECT_EQ(shown.count(std::string{cause.name}), 1U) << cause.name;
}

TEST(CausesDocument, HasEachCauseWithItsWordsInTheOrderOfWeight) {
    std::string rows;
    for (const Cause& cause : allCauses()) {
        rows.append("| `").append(cause.name).append("` | ").append(cause.sentence);
        rows.append(" | ").append(cause.remedy).append(" |\n");
    }
    EXPECT_EQ(documentedCauses(), rows);
}

}  // namespace
}  // namespace pelorus::doctor
