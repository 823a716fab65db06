// The persona that the calling thread acts in: while a request is handled,
// the persona of the peer that sent it. Set with a scope, read anywhere on
// the same thread.
#pragma once

#include <cstdint>
#include <optional>

class QRVCurrentPersona {
 public:
  // The current thread's persona id, or none.
  static std::optional<uint32_t> get();

  class Scope {
   public:
    explicit Scope(std::optional<uint32_t> persona);
    ~Scope();
    Scope(const Scope&) = delete;
    Scope& operator=(const Scope&) = delete;

   private:
    std::optional<uint32_t> saved_;
  };
};
