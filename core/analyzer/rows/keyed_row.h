#pragma once

// The machinery behind the sixteen row classes (rows/rows.h): a row class is a list of key
// fields in storage order, the order its tree sorts them in, and the table layouts it converts
// to and from. Everything else (equality, ordering, toString, construction from a transaction or
// a layout row, the copies into layout rows, the summary fold) is written once here.
//
// Key fields are fixed-width character arrays compared over their full width (strncmp), filled
// from the transaction NUL-padded.
//
// Threads: as CBaseTable. toString writes into one buffer per class and is not reentrant.

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <functional>
#include <string>
#include <string_view>
#include <type_traits>

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/rows/base_table.h"
#include "core/layouts/table_layouts.h"
#include "framework/agent_runtime.h"

namespace rows {

enum class Key : uint8_t {
  kApplication,  // ApplicationName (128), column applicatin
  kServer,       // ServerName (128), column server
  kClient,       // ClientName (128), column client
  kTransaction,  // TransactionName (128), column transactn
  kClientIP,     // IPAddress (16) of the client, column ip
  kServerIP,     // IPAddress (16) of the server, column ip
  kHostname,     // Hostname (128) of the client, column hostname
  kParentId,     // first sub-transaction identifier (32): the page's UUID, column parentuuid
  kCurrentId,    // second sub-transaction identifier (32): the object's own UUID, column curruuid
};

constexpr int KeyWidth(Key key) {
  switch (key) {
    case Key::kClientIP:
    case Key::kServerIP:
      return 16;
    case Key::kParentId:
    case Key::kCurrentId:
      return 32;
    default:
      return 128;
  }
}

// A row class's key: fields in storage order, the tree's comparison order (indexes into
// fields), and the client-name label of toString.
template <std::size_t N>
struct KeySpec {
  Key fields[N];
  int order[N];
  const char* clientLabel = "ClientName=%s\n";
};

// Carried columns: data a row keeps but does not key on, taken from the transaction (or the
// first layout row) that creates it.
struct Carried {
  int16_t importance = 99;
  char rootuuid[32] = {};
  char ipv6[128] = {};
};

// Copies text into a fixed-width field: at most width bytes, NUL-padded, unterminated when full.
inline void CopyField(char* field, const char* text, std::size_t width) {
  const std::size_t length = strnlen(text, width);
  memcpy(field, text, length);
  memset(field + length, 0, width - length);
}

// Bytes of a NUL-padded fixed-width field, up to its first NUL.
inline std::string FieldText(const char* field, int width) {
  return std::string(field, strnlen(field, width));
}

template <class Layout>
char* ColumnOf(Layout& row, Key key) {
  switch (key) {
    case Key::kApplication:
      if constexpr (requires { row.applicatin; })
        return row.applicatin;
      break;
    case Key::kServer:
      if constexpr (requires { row.server; })
        return row.server;
      break;
    case Key::kClient:
      if constexpr (requires { row.client; })
        return row.client;
      break;
    case Key::kTransaction:
      if constexpr (requires { row.transactn; })
        return row.transactn;
      break;
    case Key::kClientIP:
    case Key::kServerIP:
      if constexpr (requires { row.ip; })
        return row.ip;
      break;
    case Key::kHostname:
      if constexpr (requires { row.hostname; })
        return row.hostname;
      break;
    case Key::kParentId:
      if constexpr (requires { row.parentuuid; })
        return row.parentuuid;
      break;
    case Key::kCurrentId:
      if constexpr (requires { row.curruuid; })
        return row.curruuid;
      break;
  }
  return nullptr;
}

const char* KeySource(const CTransaction& t, Key key);

// The values a layout row holds, back as sums: averages times the request count.
struct LayoutValues {
  common_data_t common{};
  dpx_data_t dpx{};
};

template <class Layout>
LayoutValues ValuesOf(const Layout& row) {
  LayoutValues v;
  const int64_t n = row.totreq;
  v.common.dintval = row.dintval;
  v.common.totreq = row.totreq;
  v.common.failreq = row.failreq;
  v.common.slowreq = row.slowreq;
  v.common.succreq = row.succreq;
  v.common.minrtt = row.minrtt;
  v.common.mmaxrtt = row.maxrtt;
  if constexpr (requires { row.mrtthres; }) {
    v.common.mtrthres = row.mrtthres;
  }
  v.common.oatime = row.oatime * n;
  v.common.clienttime = row.clienttime * n;
  v.common.netwtime = row.netwtime * n;
  v.common.servtime = row.servtime * n;
  dpx_data_t& d = v.dpx;
#define Q7_SUM_OF_AVERAGE(sum) d.sum = row.sum * n;
  Q7_DPX_SUMS(Q7_SUM_OF_AVERAGE)
#undef Q7_SUM_OF_AVERAGE
#define Q7_COPY_COUNT(code) d.num##code = row.num##code;
  Q7_DPX_STATUS_CODES(Q7_COPY_COUNT)
#undef Q7_COPY_COUNT
  return v;
}

template <const auto& kSpec>
class TKeyedRow : public CBaseTable {
 public:
  static constexpr std::size_t kKeys = std::size(kSpec.fields);
  static constexpr bool OrderIsPermutation() {
    bool seen[kKeys] = {};
    for (int i : kSpec.order) {
      if (i < 0 || static_cast<std::size_t>(i) >= kKeys || seen[i]) {
        return false;
      }
      seen[i] = true;
    }
    return true;
  }

  bool equals(TreeNode& other, int) override {
    const TKeyedRow& o = static_cast<const TKeyedRow&>(other);
    for (std::size_t i = 0; i < kKeys; ++i) {
      if (strncmp(key(i), o.key(i), KeyWidth(kSpec.fields[i])) != 0) {
        return false;
      }
    }
    return true;
  }

  bool greater(TreeNode& other, int) override {
    const TKeyedRow& o = static_cast<const TKeyedRow&>(other);
    for (int i : kSpec.order) {
      const int c = strncmp(key(i), o.key(i), KeyWidth(kSpec.fields[i]));
      if (c != 0) {
        return c > 0;
      }
    }
    return false;
  }

  // greater and equals in one pass: the order names every field once, so rows equal in all
  // of them are equal.
  int compare(TreeNode& other, int) override {
    static_assert(OrderIsPermutation(), "a key order must name every field once");
    const TKeyedRow& o = static_cast<const TKeyedRow&>(other);
    for (int i : kSpec.order) {
      const int c = strncmp(key(i), o.key(i), KeyWidth(kSpec.fields[i]));
      if (c != 0) {
        return c > 0 ? 1 : -1;
      }
    }
    return 0;
  }

  // The key of a layout row, or of a keyed row with the same fields, as one byte string that
  // orders as rows made from it compare: each field in comparison order, up to its first NUL,
  // and a NUL after it. Comparing two such strings bytewise compares field by field as strncmp
  // does (a field that ends first is the lesser), and equal strings are equal keys. Lets a fold
  // sort rows without building them.
  template <class Source>
  static void appendSortKey(const Source& source, std::string* out) {
    for (int i : kSpec.order) {
      const Key field = kSpec.fields[i];
      const char* text;
      if constexpr (std::is_base_of_v<CBaseTable, Source>) {
        text = source.keyField(field);
      } else {
        text = ColumnOf(const_cast<Source&>(source), field);
      }
      out->append(text, strnlen(text, KeyWidth(field)));
      out->push_back('\0');
    }
  }

  // The key field for key, KeyWidth bytes; the row must have that field.
  const char* keyField(Key field) const {
    std::size_t i = 0;
    while (i + 1 < kKeys && kSpec.fields[i] != field) {
      ++i;
    }
    return key(i);
  }

  const char* toString(int) override {
    static char buffer[1024];
    buffer[0] = '\0';
    std::size_t used = 0;
    for (std::size_t i = 0; i < kKeys; ++i) {
      const std::string text = FieldText(key(i), KeyWidth(kSpec.fields[i]));
      used += snprintf(buffer + used, sizeof(buffer) - used, Label(kSpec.fields[i]), text.c_str());
    }
    return buffer;
  }

  // A hash of the key: equal for two rows when equals() holds (each field counts up to its
  // first NUL or its width).
  std::size_t indexHash() const {
    std::size_t h = 0;
    for (std::size_t i = 0; i < kKeys; ++i) {
      h = HashStep(h, key(i), KeyWidth(kSpec.fields[i]));
    }
    return h;
  }
  // What indexHash and equals would answer for a row built from t, without building one: the
  // lookup of an existing row then copies no key.
  static std::size_t indexHashOf(const CTransaction& t) {
    std::size_t h = 0;
    for (std::size_t i = 0; i < kKeys; ++i) {
      h = HashStep(h, KeySource(t, kSpec.fields[i]), KeyWidth(kSpec.fields[i]));
    }
    return h;
  }
  bool hasKeyOf(const CTransaction& t) const {
    for (std::size_t i = 0; i < kKeys; ++i) {
      if (strncmp(key(i), KeySource(t, kSpec.fields[i]), KeyWidth(kSpec.fields[i])) != 0) {
        return false;
      }
    }
    return true;
  }

  // The key field in storage position i, KeyWidth bytes, NUL-padded, unterminated when full.
  const char* key(std::size_t i) const { return keys_ + kOffsets.at[i]; }

 private:
  // Each field counts up to its first NUL or its width, as CopyField keeps it.
  static std::size_t HashStep(std::size_t h, const char* field, std::size_t width) {
    const std::string_view text(field, strnlen(field, width));
    return h * 1000003u ^ std::hash<std::string_view>{}(text);
  }

 public:
  const Carried& carried() const { return carried_; }

 protected:
  TKeyedRow() = default;

  // Keys and carried columns from a transaction; the threshold and aggregation flags too.
  explicit TKeyedRow(const CTransaction& t) {
    for (std::size_t i = 0; i < kKeys; ++i) {
      CopyField(keyAt(i), KeySource(t, kSpec.fields[i]), KeyWidth(kSpec.fields[i]));
    }
    carried_.importance = static_cast<int16_t>(t.getImportance());
    CopyField(carried_.rootuuid, t.getRootUUID(), sizeof(carried_.rootuuid));
    for (Key field : kSpec.fields) {
      if (field == Key::kServerIP) {
        CopyField(carried_.ipv6, t.getServerIPv6Address(), sizeof(carried_.ipv6));
      } else if (field == Key::kClientIP) {
        CopyField(carried_.ipv6, t.getClientIPv6Address(), sizeof(carried_.ipv6));
      }
    }
    commonData.mtrthres = t.getMinThreshold();
    aggBy = t.getAggBy();
  }

  // Keys, carried columns, interval and aggregation flags from a layout row.
  template <class Layout>
  void takeIdentity(const Layout& row) {
    for (std::size_t i = 0; i < kKeys; ++i) {
      memcpy(keyAt(i), ColumnOf(const_cast<Layout&>(row), kSpec.fields[i]),
             KeyWidth(kSpec.fields[i]));
    }
    if constexpr (requires { row.importance; })
      carried_.importance = row.importance;
    if constexpr (requires { row.rootuuid; }) {
      memcpy(carried_.rootuuid, row.rootuuid, sizeof(carried_.rootuuid));
    }
    if constexpr (requires { row.ipv6; })
      memcpy(carried_.ipv6, row.ipv6, sizeof(carried_.ipv6));
    if constexpr (requires { row.aggby; })
      aggBy = row.aggby;
    setTimestamp(row.timestamp);
  }

  // The row as a table row of the given layout (sampletime is left for the query to stamp).
  template <class Layout>
  void fillLayout(Layout& row) const {
    memset(&row, 0, sizeof(row));
    CommonColumns c = getCommonCounts();
    fillFoldColumns(row, c);
    CopyField(row.originnode, OriginNode(), sizeof(row.originnode));
    CopyField(row.datcoltype, "DPX", sizeof(row.datcoltype));
    addCommonPercentages(&c);
    row.pcfail = c.pcfail;
    row.pcslow = c.pcslow;
    row.pcgood = c.pcgood;
    row.pcavail = c.pcavail;
    row.rank =
        static_cast<int32_t>(calculateRank(c.pcfail / 1000, c.pcslow / 1000, carried_.importance));
#define Q7_PERCENT(code) \
  row.pct##code = percentOfRequests(kindData.dpx.num##code, commonData.totreq);
    Q7_DPX_STATUS_CODES(Q7_PERCENT)
#undef Q7_PERCENT
  }

  // Only the columns of the layout that a summary fold reads (TSummaryRow's constructor and
  // Update): keys, carried columns, aggby, threshold, timestamp, counts, averages and status
  // counts, as fillLayout writes them. The other columns are left as they were.
  template <class Layout>
  void fillFoldColumns(Layout& row) const {
    fillFoldColumns(row, getCommonCounts());
  }
  template <class Layout>
  void fillFoldColumns(Layout& row, const CommonColumns& c) const {
    for (std::size_t i = 0; i < kKeys; ++i) {
      memcpy(ColumnOf(row, kSpec.fields[i]), key(i), KeyWidth(kSpec.fields[i]));
    }
    if constexpr (requires { row.importance; })
      row.importance = carried_.importance;
    if constexpr (requires { row.rootuuid; }) {
      memcpy(row.rootuuid, carried_.rootuuid, sizeof(row.rootuuid));
    }
    if constexpr (requires { row.ipv6; })
      memcpy(row.ipv6, carried_.ipv6, sizeof(row.ipv6));
    if constexpr (requires { row.aggby; })
      row.aggby = aggBy;
    if constexpr (requires { row.mrtthres; })
      row.mrtthres = commonData.mtrthres;
    memcpy(row.timestamp, timestamp, sizeof(row.timestamp));
#define Q7_COPY_COMMON(column) row.column = c.column;
    Q7_COMMON_COLUMNS(Q7_COPY_COMMON)
#undef Q7_COPY_COMMON
    const int32_t n = commonData.totreq;
    const dpx_data_t& d = kindData.dpx;
#define Q7_AVERAGE(sum) row.sum = perRequest(d.sum, n);
    Q7_DPX_SUMS(Q7_AVERAGE)
#undef Q7_AVERAGE
#define Q7_COUNT(code) row.num##code = d.num##code;
    Q7_DPX_STATUS_CODES(Q7_COUNT)
#undef Q7_COUNT
  }

 private:
  struct Offsets {
    int at[kKeys];
    int total;
  };
  static constexpr Offsets kOffsets = [] {
    Offsets o{};
    for (std::size_t i = 0; i < kKeys; ++i) {
      o.at[i] = o.total;
      o.total += KeyWidth(kSpec.fields[i]);
    }
    return o;
  }();

  static const char* Label(Key key) {
    switch (key) {
      case Key::kApplication:
        return "ApplicationName=%s\n";
      case Key::kServer:
        return "ServerName=%s\n";
      case Key::kClient:
        return kSpec.clientLabel;
      case Key::kTransaction:
        return "TransactionName=%s\n";
      case Key::kClientIP:
      case Key::kServerIP:
        return "IPAddress=%s\n";
      case Key::kHostname:
        return "Hostname=%s\n";
      case Key::kParentId:
        return "ParentUUID=%s\n";
      case Key::kCurrentId:
        return "CurrentUUID=%s\n";
    }
    return "";
  }

  static const char* OriginNode();

  char* keyAt(std::size_t i) {
    return keys_ + kOffsets.at[i];
  }

  // Both constructors write every key byte, so the keys need no clearing first: rows are built
  // for every lookup on the per-transaction path.
  char keys_[kOffsets.total];
  Carried carried_;
};

template <const auto& kSpec>
const char* TKeyedRow<kSpec>::OriginNode() {
  static const std::string origin = fw::OriginNodeName();
  return origin.c_str();
}

// An over-time row: one key in one interval, fed transaction by transaction; Layout is its
// exported over-time row, also the form it takes in history files.
template <const auto& kSpec, class Layout>
class TOverTimeRow : public TKeyedRow<kSpec> {
 public:
  using LayoutType = Layout;

  explicit TOverTimeRow(CTransaction& t) : TKeyedRow<kSpec>(t) {}

  // A row read back from history: sums are rebuilt as averages times the request count.
  explicit TOverTimeRow(const Layout& row) {
    this->takeIdentity(row);
    const LayoutValues v = ValuesOf(row);
    this->commonData = v.common;
    this->kindData.dpx = v.dpx;
  }

  void getQ7Struct(Layout& row) const { this->fillLayout(row); }
  // Only the columns a summary fold reads, at a fraction of getQ7Struct's cost.
  void getFoldColumns(Layout& row) const { this->fillFoldColumns(row); }
};

// A summary row: one key over the summary period, built by folding exported over-time rows of
// the same key into it. Layout is the summary table's row.
template <const auto& kSpec, class OverTimeLayout, class Layout>
class TSummaryRow : public TKeyedRow<kSpec> {
 public:
  using LayoutType = Layout;
  using OverTimeLayoutType = OverTimeLayout;

  // Keys, carried columns, threshold and interval come from the first row folded in.
  explicit TSummaryRow(const OverTimeLayout& row) {
    this->takeIdentity(row);
    this->commonData.dintval = row.dintval;
    if constexpr (requires { row.mrtthres; })
      this->commonData.mtrthres = row.mrtthres;
    Update(row);
  }

  // Adds an over-time row of the same key.
  void Update(const OverTimeLayout& row) {
    const LayoutValues v = ValuesOf(row);
    const common_data_t& c = v.common;
    reaggregateCommonData(this->commonData, c.totreq, c.failreq, c.slowreq, c.succreq, 0, c.oatime,
                          c.clienttime, c.servtime, c.netwtime, c.minrtt, c.mmaxrtt, 0);
    reaggregateDPXData(this->kindData.dpx, v.dpx);
  }

  void getQ7Struct(Layout& row) const { this->fillLayout(row); }
};

}  // namespace rows
