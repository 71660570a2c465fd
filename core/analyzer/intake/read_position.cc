#include "core/analyzer/intake/read_position.h"

#include <sys/stat.h>

#include "core/analyzer/intake/common.h"
#include "core/runtime/clog.h"

namespace {

bool SameFile(const char* path, const ReadPosition& position, bool* exists) {
  struct stat st {};
  *exists = ::stat(path, &st) == 0;
  return *exists && static_cast<uint64_t>(st.st_dev) == position.device &&
         static_cast<uint64_t>(st.st_ino) == position.inode;
}

}  // namespace

std::string FindFileByIdentity(const char* directory, uint64_t device, uint64_t inode) {
  if (device == 0 && inode == 0) {
    return "";
  }
  const ReadPosition wanted{"", device, inode, 0};
  std::string found;
  _FILE_INFO_LL* const list = CCommon::findFiles(directory, "*.sm3");
  for (const _FILE_INFO_LL* node = list; node != nullptr && found.empty(); node = node->next) {
    bool present = false;
    if (SameFile(node->fileName, wanted, &present)) {
      found = node->fileName;
    }
  }
  CCommon::deleteFoundFiles(list);
  return found;
}

ReadPosition LocateReadPosition(const ReadPosition& saved, const char* directory) {
  static const char* const kWhere = "LocateReadPosition";
  bool exists = false;
  if (saved.file.empty() || (saved.device == 0 && saved.inode == 0) ||
      SameFile(saved.file.c_str(), saved, &exists)) {
    return saved;
  }
  ReadPosition found = saved;
  const std::string renamedTo = FindFileByIdentity(directory, saved.device, saved.inode);
  if (!renamedTo.empty()) {
    found.file = renamedTo;
    CLOG::min("%s [%s] was renamed [%s] since the checkpoint; resuming there at offset[%lld]",
              kWhere, saved.file.c_str(), found.file.c_str(), found.offset);
  } else if (exists) {
    CLOG::min(
        "%s [%s] is another file than at the checkpoint and the old one is gone; "
        "resuming it at offset 0",
        kWhere, saved.file.c_str());
    found.offset = 0;
  }
  return found;
}
