// The column descriptions match the layout rule worked out independently of the compiler, and
// positions checked by hand.

#include "q7tema/table_columns.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <span>
#include <string>
#include <vector>

namespace q7tema {
namespace {

struct DeclaredColumn {
  char kind;  // 'S', 'X', 'I' or 'H'
  const char* name;
  int width;
};

struct Layout {
  const char* table;
  std::vector<DeclaredColumn> declared;
  std::span<const fw::ColumnInfo> columns;
  std::size_t row_size;
};

#define DECLARED(kind, name, width) DeclaredColumn{#kind[0], #name, width},
#define LAYOUT(lower, exported, COLUMNS) \
  Layout{exported, {COLUMNS(DECLARED)}, kq7_##lower##_columns, sizeof(kq7_##lower##_data_t)},
const std::vector<Layout> kLayouts = {Q7_EXPORTED_TABLES(LAYOUT) Q7_UNEXPORTED_LAYOUTS(LAYOUT)};
#undef LAYOUT
#undef DECLARED

// Text is byte-aligned at full width, an integer aligned to its own size, and the row rounded
// up to its largest integer alignment.
std::vector<int> ExpectedOffsets(const std::vector<DeclaredColumn>& declared, int* row_size) {
  std::vector<int> offsets;
  int at = 0;
  int row_alignment = 1;
  for (const DeclaredColumn& column : declared) {
    const int alignment = column.kind == 'I' ? 4 : column.kind == 'H' ? 2 : 1;
    row_alignment = std::max(row_alignment, alignment);
    at = (at + alignment - 1) / alignment * alignment;
    offsets.push_back(at);
    at += column.width;
  }
  *row_size = (at + row_alignment - 1) / row_alignment * row_alignment;
  return offsets;
}

int OffsetOf(std::span<const fw::ColumnInfo> columns, const std::string& name) {
  const auto it = std::find_if(columns.begin(), columns.end(),
                               [&](const fw::ColumnInfo& c) { return name == c.name; });
  return it == columns.end() ? -1 : it->offset;
}

TEST(TableColumnsTest, EveryLayoutFollowsTheAlignmentRule) {
  ASSERT_EQ(26u, kLayouts.size());
  for (const Layout& layout : kLayouts) {
    SCOPED_TRACE(layout.table);
    int row_size = 0;
    const std::vector<int> offsets = ExpectedOffsets(layout.declared, &row_size);
    EXPECT_EQ(static_cast<std::size_t>(row_size), layout.row_size);
    ASSERT_EQ(layout.declared.size(), layout.columns.size());
    for (std::size_t i = 0; i < offsets.size(); ++i) {
      const DeclaredColumn& d = layout.declared[i];
      const fw::ColumnInfo& c = layout.columns[i];
      const int type = d.kind == 'S' ? 9 : d.kind == 'I' ? 3 : d.kind == 'H' ? 5 : 12;
      EXPECT_STREQ(d.name, c.name);
      EXPECT_EQ(type, c.type) << d.name;
      EXPECT_EQ(d.width, c.width) << d.name;
      EXPECT_EQ(offsets[i], c.offset) << d.name;
    }
  }
}

// Worked out by hand: padding after an odd-sized string before an integer, and rows with only
// 16-bit or no integers.
TEST(TableColumnsTest, HandCheckedPositions) {
  EXPECT_EQ(0, OffsetOf(kq7_q7appot_columns, "applicatin"));
  EXPECT_EQ(128, OffsetOf(kq7_q7appot_columns, "importance"));
  EXPECT_EQ(130, OffsetOf(kq7_q7appot_columns, "originnode"));
  EXPECT_EQ(162, OffsetOf(kq7_q7appot_columns, "timestamp"));
  EXPECT_EQ(180, OffsetOf(kq7_q7appot_columns, "dintval"));
  EXPECT_EQ(416u, sizeof(kq7_q7appot_data_t));
  EXPECT_EQ(820, OffsetOf(kq7_q7txptns_columns, "sampercent"));
  EXPECT_EQ(844, OffsetOf(kq7_q7txptns_columns, "mrtthres"));
  EXPECT_EQ(848u, sizeof(kq7_q7txptns_data_t));
  EXPECT_EQ(686, OffsetOf(kq7_q7clntptns_columns, "agguniqly"));
  EXPECT_EQ(704u, sizeof(kq7_q7clntptns_data_t));
  EXPECT_EQ(574u, sizeof(kq7_q7agntdts_data_t));
  EXPECT_EQ(1156, OffsetOf(kq7_q7agntmsgs_columns, "msgsource"));
}

}  // namespace
}  // namespace q7tema
