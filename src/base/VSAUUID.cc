#include "base/VSAUUID.h"

#include <uuid/uuid.h>

VSAUUID VSAUUID::random() {
  Bytes b;
  uuid_generate_random(b.data());
  return VSAUUID(b);
}

std::optional<VSAUUID> VSAUUID::parse(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  char buf[37];
  text.copy(buf, 36);
  buf[36] = '\0';
  Bytes b;
  if (uuid_parse(buf, b.data()) != 0) return std::nullopt;
  return VSAUUID(b);
}

std::string VSAUUID::string() const {
  char buf[37];
  uuid_unparse_upper(bytes_.data(), buf);
  return std::string(buf, 36);
}

bool VSAUUID::isNull() const {
  for (uint8_t c : bytes_)
    if (c) return false;
  return true;
}
