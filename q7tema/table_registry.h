#pragma once

// The 23 exported tables in the order the agent loader initialises them, and the hook through
// which each table's init function is supplied. Tables whose classes are not built register
// nothing; the loader then reports them as absent and goes on.
//
// Thread safety: registration happens during static initialisation or start-up on the main
// thread; InitAllTables runs on the thread that runs the agent loader.

#include <array>
#include <string_view>

namespace q7tema {

// kq7_<name>_init names, in load order.
inline constexpr std::array<std::string_view, 23> kTableLoadOrder = {
    "q7agntdts",  "q7agntmsgs", "q7appot",   "q7appsm",    "q7clntapp", "q7clntot",
    "q7clntptns", "q7clntsm",   "q7clntsrv", "q7srvappsm", "q7srvot",   "q7srvsm",
    "q7txins",    "q7txot",     "q7txptns",  "q7txsm",     "q7txcs",    "q7appcs",
    "q7clntcs",   "q7srvcs",    "q7subtxsm", "q7subtxot",  "q7subtxins"};

using TableInitFunction = void (*)();

// Supplies the init function of the table named in kTableLoadOrder. Returns false for a name
// that is not one of the 23.
bool RegisterTableInit(std::string_view name, TableInitFunction init);

// Calls the registered init functions in load order. Returns how many tables were initialised;
// each table without an init function leaves one summary trace line.
int InitAllTables();

// Forgets every init function (tests only).
void ResetTableInitsForTesting();

}  // namespace q7tema
