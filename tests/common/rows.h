#pragma once

#include <gtest/gtest.h>

#include <ostream>
#include <string>

// Instantiates Suite over a table whose rows carry a `name`; rows print as that name, so test and
// ctest listings read "Rows/Suite.Case/RowName" rather than a dump of the row's bytes.
#define ZLKA_ROWS(Suite, Row, table)                                                     \
  [[maybe_unused]] void PrintTo(const Row& row, std::ostream* out) { *out << row.name; } \
  INSTANTIATE_TEST_SUITE_P(Rows, Suite, ::testing::ValuesIn(table),                      \
                           [](const auto& info) { return std::string(info.param.name); })
