// System facts from an os-release file: VARIANT_ID=internal marks an internal
// build, BUILD_ID is the build version. Read once, on first use.
#pragma once

#include <mutex>
#include <string>

#include "platform/QRVSystemInfo.h"

class QRVLinuxSystemInfo : public QRVSystemInfo {
 public:
  explicit QRVLinuxSystemInfo(std::string osReleasePath) : path_(std::move(osReleasePath)) {}
  bool isInternalBuild() override;
  std::string buildVersion() override;
  QRVPlist systemVersion() override;

  // Parses os-release text: KEY=value lines, values optionally quoted.
  static QRVPlist parse(const std::string& text);

 private:
  const QRVPlist& values();

  const std::string path_;
  std::once_flag once_;
  QRVPlist values_;
};
