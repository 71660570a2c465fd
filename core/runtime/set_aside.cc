#include "core/runtime/set_aside.h"

#include <cerrno>
#include <cstring>

#include "core/runtime/clog.h"
#include "framework/atomic_file.h"

bool SetAsideTraced(const char* what, const std::string& path, const std::string& why) {
  const std::string aside = fw::SetFileAside(path);
  if (aside.empty()) {
    CLOG::error("%s %s does not load (%s) and could not be set aside: %s", what, path.c_str(),
                why.c_str(), std::strerror(errno));
    return false;
  }
  CLOG::error("%s %s does not load (%s); set aside as %s, starting without it", what, path.c_str(),
              why.c_str(), aside.c_str());
  return true;
}
