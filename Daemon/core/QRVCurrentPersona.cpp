#include "core/QRVCurrentPersona.h"

namespace {
thread_local std::optional<uint32_t> tPersona;
}

std::optional<uint32_t> QRVCurrentPersona::get() { return tPersona; }

QRVCurrentPersona::Scope::Scope(std::optional<uint32_t> persona) : saved_(tPersona) { tPersona = persona; }
QRVCurrentPersona::Scope::~Scope() { tPersona = saved_; }
