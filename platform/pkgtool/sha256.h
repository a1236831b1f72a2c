// Incremental SHA-256 (OpenSSL's, which uses the CPU's SHA instructions).
#pragma once

#include <cstddef>
#include <string>

class Sha256 {
 public:
  Sha256();
  ~Sha256();
  Sha256(const Sha256&) = delete;
  Sha256& operator=(const Sha256&) = delete;

  void Update(const void* data, size_t size);
  // The digest as lower-case hex; "" when OpenSSL failed at any step (so it
  // never equals a digest it was meant to match). The object is spent
  // afterwards.
  [[nodiscard]] std::string FinishHex();

 private:
  void* ctx_;
  bool ok_;
};
