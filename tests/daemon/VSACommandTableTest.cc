// The command list: every name once, every number once, the numbers 0..32
// with none missing; and the command table binds each entry to the number of
// its index, so that an entry moved or swapped in the table is caught.
#include <gtest/gtest.h>

#include <set>
#include <string>

#include "base/VSACommands.h"
#include "daemon/VSACommandTable.h"

namespace {

TEST(VSACommands, EachNameAndNumberOnceNumberedZeroToThirtyTwo) {
  ASSERT_EQ(VSACommands::kCount, 33u);
  std::set<std::string> names;
  std::set<VSACommandNumber> numbers;
  for (size_t i = 0; i < VSACommands::kCount; ++i) {
    const auto& d = VSACommands::kAll[i];
    EXPECT_TRUE(names.insert(d.name).second) << d.name << " is listed twice";
    EXPECT_TRUE(numbers.insert(d.number).second) << d.name << " reuses " << d.number;
    EXPECT_LE(d.number, 32u) << d.name;
    EXPECT_EQ(d.number, i) << d.name << " is out of order";
    EXPECT_NE(std::string(d.meaning), "") << d.name;
  }
  EXPECT_EQ(numbers.size(), 33u);
}

TEST(VSACommands, TheConstantsAreTheListsNumbers) {
  // A few constants against the list's rows, and against the numbers the
  // protocol has always used for them.
  const auto row = [](VSACommandNumber n) { return std::string(VSACommands::kAll[n].name); };
  EXPECT_EQ(row(VSACommands::kCreateOrLookup), "kCreateOrLookup");
  EXPECT_EQ(VSACommands::kCreateOrLookup, 0u);
  EXPECT_EQ(row(VSACommands::kDeleteDeathRow), "kDeleteDeathRow");
  EXPECT_EQ(VSACommands::kDeleteDeathRow, 4u);
  EXPECT_EQ(row(VSACommands::kSetDataProtection), "kSetDataProtection");
  EXPECT_EQ(VSACommands::kSetDataProtection, 21u);
  EXPECT_EQ(row(VSACommands::kRetired), "kRetired");
  EXPECT_EQ(VSACommands::kRetired, 27u);
  EXPECT_EQ(row(VSACommands::kTestLock), "kTestLock");
  EXPECT_EQ(VSACommands::kTestLock, 31u);
  EXPECT_EQ(row(VSACommands::kPersonaUniqueStrings), "kPersonaUniqueStrings");
  EXPECT_EQ(VSACommands::kPersonaUniqueStrings, 32u);
}

TEST(VSACommandTable, EveryEntryCarriesItsIndexAndTheListsNumberForItsName) {
  const auto& table = VSACommandTable();
  ASSERT_EQ(table.size(), VSACommands::kCount);
  for (size_t i = 0; i < table.size(); ++i) {
    EXPECT_EQ(table[i].command, i) << "entry " << i << " is bound to another command";
    EXPECT_EQ(table[i].command, VSACommands::kAll[i].number)
        << "entry " << i << " is not " << VSACommands::kAll[i].name;
    EXPECT_NE(table[i].entitlement, nullptr) << VSACommands::kAll[i].name;
  }
}

TEST(VSACommandTable, TheNamedCommandsHaveTheirHandlers) {
  // The entries whose handler is shared or special, looked up by name.
  const auto& table = VSACommandTable();
  EXPECT_EQ(table[VSACommands::kRecreateDefaultStructure].handler,
            VSAHandleRecreateDefaultStructure);
  EXPECT_EQ(table[VSACommands::kRestoreDefaultStructure].handler,
            VSAHandleRecreateDefaultStructure);
  EXPECT_EQ(table[VSACommands::kRetired].handler, VSAHandleRetiredCommand);
  EXPECT_EQ(table[VSACommands::kTestLock].handler, VSAHandleTestLock);
  EXPECT_EQ(table[VSACommands::kCreateOrLookup].handler, VSAHandleCreateOrLookup);
  EXPECT_EQ(table[VSACommands::kPersonaUniqueStrings].handler, VSAHandlePersonaUniqueStrings);
}

}  // namespace
