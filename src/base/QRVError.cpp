#include "base/QRVError.h"

QRVError QRVError::make(const char* domain, uint64_t code, const char* function, uint32_t line,
                        int level, std::string message,
                        std::shared_ptr<const QRVError> underlying) {
  QRVError e;
  e.domain_ = domain;
  e.code_ = code;
  e.message_ = std::move(message);
  e.function_ = function;
  e.line_ = line;
  e.underlying_ = std::move(underlying);
  if (level >= 0) QRVLog::write(level, function, e.description());
  return e;
}

std::string QRVError::description() const {
  std::string s = fmt::format("{} {}: {} ({}:{})", domain_, code_, message_, function_, line_);
  if (underlying_) s += " <- " + underlying_->description();
  return s;
}
