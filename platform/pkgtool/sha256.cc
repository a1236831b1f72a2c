#include "pkgtool/sha256.h"

#include "klibc/hex.h"

#include <openssl/evp.h>

Sha256::Sha256() : ctx_(EVP_MD_CTX_new()) {
  ok_ = ctx_ && EVP_DigestInit_ex(static_cast<EVP_MD_CTX*>(ctx_), EVP_sha256(), nullptr) == 1;
}

Sha256::~Sha256() { EVP_MD_CTX_free(static_cast<EVP_MD_CTX*>(ctx_)); }

void Sha256::Update(const void* data, size_t size) {
  if (ok_) ok_ = EVP_DigestUpdate(static_cast<EVP_MD_CTX*>(ctx_), data, size) == 1;
}

std::string Sha256::FinishHex() {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  if (!ok_ || EVP_DigestFinal_ex(static_cast<EVP_MD_CTX*>(ctx_), digest, &len) != 1) return "";
  ok_ = false;
  return KIVOHex(digest, len);
}
