#pragma once

// What every table's agent object shares (kq7_<table>_base): the request it serves, its
// table's manager, handing rows to the framework, the column descriptions, tracing a row and
// testing a row against a filter condition.
//
// Thread safety: an agent object is used by one thread at a time (see fw::TableAgent).

#include <span>
#include <string_view>

#include "framework/request.h"
#include "framework/status.h"
#include "framework/table_manager.h"
#include "framework/tables.h"
#include "q7tema/table_columns.h"

namespace q7tema {

template <typename Row>
class TableManager;

// Fills *info with columns[index]: an empty description (and kOk) for index == columns.size(),
// fw::kBadColumnIndex for an index below 0 or beyond that, kInvalidArgument for a null info.
int FillColumnInfo(std::span<const fw::ColumnInfo> columns, fw::ColumnInfo* info, int index);

// Traces *row one record per column: "\t\t<name>=\"<text>\"" for text columns (at most the
// column's width), "\t\t<name>=<number>" for integers.
void PrintRow(const void* row, std::span<const fw::ColumnInfo> columns);

// True when *row does not satisfy the condition; also (traced) when the condition names a
// column the table does not have.
bool RowIsException(std::string_view table, const void* row,
                    std::span<const fw::ColumnInfo> columns, const fw::Condition& condition);

template <typename Row>
class TableBase : public fw::TableAgent {
 public:
  using Layout = TableLayout<Row>;

  // *request and *manager must outlive this object.
  TableBase(fw::Request* request, TableManager<Row>* manager)
      : request_(request), manager_(manager) {}
  TableBase(const TableBase&) = delete;
  TableBase& operator=(const TableBase&) = delete;

  fw::Request* request() const { return request_; }
  TableManager<Row>* manager() const { return manager_; }

  // Hands count rows to the framework: they are copied into the request's rows. Returns kOk
  // or kInvalidArgument (see fw::AddRows).
  int AddData(const Row* rows, int count) {
    return fw::AddRows(request_, rows, sizeof(Row), count);
  }

  int NumColumns() const { return static_cast<int>(Layout::kColumns.size()); }

  // Describes column index; see FillColumnInfo for the edge cases.
  int GetColumnInfo(fw::ColumnInfo* info, int index) const {
    return FillColumnInfo(Layout::kColumns, info, index);
  }

  // Traces row one line per column.
  void PrintSelf(const Row& row) const { PrintRow(&row, Layout::kColumns); }

  // True when row's column named by the condition does not satisfy it.
  bool ColumnIsException(const Row& row, const fw::Condition& condition) const {
    return RowIsException(Layout::kName, &row, Layout::kColumns, condition);
  }

 private:
  fw::Request* const request_;
  TableManager<Row>* const manager_;
};

}  // namespace q7tema
