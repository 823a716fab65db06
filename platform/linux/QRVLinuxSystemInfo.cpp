#include "platform/linux/QRVLinuxSystemInfo.h"

#include <fstream>
#include <sstream>

QRVPlist QRVLinuxSystemInfo::parse(const std::string& text) {
  QRVPlist out = QRVPlist::dictionary();
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) {
    size_t eq = line.find('=');
    if (line.empty() || line[0] == '#' || eq == std::string::npos || eq == 0) continue;
    std::string key = line.substr(0, eq), value = line.substr(eq + 1);
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') && value.back() == value.front()) {
      value = value.substr(1, value.size() - 2);
      std::string unescaped;
      for (size_t i = 0; i < value.size(); i++) {
        if (value[i] == '\\' && i + 1 < value.size()) i++;
        unescaped += value[i];
      }
      value = unescaped;
    }
    out.set(key, QRVPlist::string(value));
  }
  return out;
}

const QRVPlist& QRVLinuxSystemInfo::values() {
  std::call_once(once_, [this] {
    std::ifstream in(path_);
    std::stringstream ss;
    ss << in.rdbuf();
    values_ = parse(ss.str());
  });
  return values_;
}

bool QRVLinuxSystemInfo::isInternalBuild() { return values().stringForKey("VARIANT_ID") == "internal"; }
std::string QRVLinuxSystemInfo::buildVersion() { return values().stringForKey("BUILD_ID"); }
QRVPlist QRVLinuxSystemInfo::systemVersion() { return values(); }
