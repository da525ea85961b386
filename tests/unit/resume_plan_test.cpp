// The resume's header offset and the restart code's copy with its sum (the
// rest of the plan is read through in the resume tests).
#include <gtest/gtest.h>

#include <vector>

#include "resume/plan.h"
#include "resume/restart.h"
#include "resume_image.h"

namespace {

using namespace nimb;

TEST(ResumePlanTest, HeaderOffsetCoversFrontPartAndMapOnWholePages) {
  const struct {
    UINT32 mapCapacity;
    UINT32 headerOffset;
  } rows[] = {{0xCEC, 0x1000}, {0xCEE, 0x2000}, {0x1000, 0x2000}, {0, 0x1000}};
  for (const auto &row : rows)
    EXPECT_EQ(ResumeHeaderOffset(row.mapCapacity), row.headerOffset) << std::hex << row.mapCapacity;
}

TEST(ResumeRestartTest, RestartCodeIsCopiedAndSummedPageByPage) {
  std::vector<uint8_t> mixed(3 * 4096);
  for (size_t i = 0; i < mixed.size(); i++)
    mixed[i] = uint8_t(i * 131 + (i >> 12));
  const struct {
    const char *name;
    std::vector<uint8_t> code;
    UINT32 sum;
  } rows[] = {
      {"no pages", {}, 0},
      {"a page of zeros", std::vector<uint8_t>(4096, 0), 0x10000001},
      {"a page of 0xFF", std::vector<uint8_t>(4096, 0xFF), 0x8161F0E2},
      {"two pages of 0xFF wrap round", std::vector<uint8_t>(8192, 0xFF), 0x02C3E1C4},
      {"three pages of a pattern", mixed, nimbtest::PageSums(mixed)},
  };
  for (const auto &row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<uint8_t> destination(row.code.size() + 1, 0xEE);
    EXPECT_EQ(ResumeCopyRestartCode(destination.data(), row.code.data(), UINT32(row.code.size() / 4096)),
              row.sum);
    EXPECT_TRUE(std::equal(row.code.begin(), row.code.end(), destination.begin()));
    EXPECT_EQ(destination.back(), 0xEE);
  }
}

}  // namespace
