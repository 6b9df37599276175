#include "daemons/kavoelasticd/pack.h"

#include <gtest/gtest.h>

#include <random>
#include <string>

#include "daemons/kavoelasticd/failure.h"

namespace {

using namespace std::string_literals;
using vexlo::elasticd::Pack;
using vexlo::elasticd::Unpack;

TEST(Pack, GivesTheTextBack) {
  std::mt19937_64 random(1);
  std::string noise(100000, '\0');
  for (char& c : noise) {
    c = static_cast<char>(random());
  }
  const struct {
    const char* name;
    std::string text;
    size_t most;  // Bytes that it may take packed.
  } rows[] = {
      {"empty", "", 1},
      {"one byte", "a", 2},
      {"NUL and no UTF-8", "a\0\xff\xfe"s, 5},
      {"noise", noise, noise.size() + 1},
      {"the same again and again", std::string(1000000, 'x'), 1000},
  };
  for (const auto& row : rows) {
    const std::string packed = Pack(row.text);
    EXPECT_LE(packed.size(), row.most) << row.name;
    EXPECT_EQ(Unpack(packed), row.text) << row.name;
  }
}

TEST(Pack, WhatIsDamagedIsRefused) {
  const std::string good = Pack(std::string(5000, 'x'));
  const struct {
    const char* name;
    std::string packed;
  } rows[] = {
      {"nothing", ""},
      {"another form", "\2" + good.substr(1)},
      {"no frame", "\1text"},
      {"cut short", good.substr(0, good.size() - 1)},
      {"only the form", good.substr(0, 1)},
      // The magic number, a descriptor with eight bytes of length in one segment, and the length.
      {"a length that cannot be", "\1\x28\xb5\x2f\xfd\xe0"s + std::string(8, '\x7f')},
      {"more behind it", good + "x"},
  };
  for (const auto& row : rows) {
    try {
      Unpack(row.packed);
      ADD_FAILURE() << row.name;
    } catch (const vexlo::elasticd::Failure& failure) {
      EXPECT_EQ(failure.GetCode(), vexlo::elasticd::Code::kIndexDamaged) << row.name;
    }
  }
}

}  // namespace
