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

uint64_t QRVError::resultCode() const {
  if (domain_ == kDomain && code_ != 0) return code_;
  QRVLogError("Internal error: a request failed without a result code ({}); answering {}",
              domain_.empty() ? std::string("no error was set") : description(),
              static_cast<uint64_t>(QRVResultCode::kException));
  return QRVResultCode::kException;
}
