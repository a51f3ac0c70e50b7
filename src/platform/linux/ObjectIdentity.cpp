#include "platform/linux/ObjectIdentity.h"

#include <sodium/crypto_shorthash.h>

static_assert(crypto_shorthash_KEYBYTES == 16 && crypto_shorthash_BYTES == 8);

namespace {
// Those of Unmapped go on from here.
enum Kind : uint64_t { kFile = 1, kSysV = 2, kProcess = 3, kFamily = 4 };
}  // namespace

// "xxxxxxxx-xxxx-...": the hexadecimal digits are the key.
ObjectIdentity::ObjectIdentity(std::string_view bootId) {
    size_t digits = 0;
    for (const char character : bootId) {
        const size_t digit = std::string_view("0123456789abcdef").find(character);
        if (digit != std::string_view::npos && digits < 2 * _key.size()) {
            _key[digits / 2] = static_cast<unsigned char>((_key[digits / 2] << 4U) | digit);
            ++digits;
        }
    }
}

uint64_t ObjectIdentity::file(uint64_t device, uint64_t inode) const {
    return _hash({kFile, device, inode, 0});
}

uint64_t ObjectIdentity::sysV(uint64_t device, uint64_t inode, uint64_t ipcNamespace) const {
    return _hash({kSysV, device, inode, ipcNamespace});
}

uint64_t ObjectIdentity::process(int32_t pid, uint64_t startTime, uint64_t address) const {
    return _hash({kProcess, static_cast<uint64_t>(pid), startTime, address});
}

uint64_t ObjectIdentity::family(const FamilyMemory& memory) const {
    const uint64_t detail = (uint64_t{memory.tag} << 32U) | memory.generation;
    return _hash({kFamily, memory.family, memory.window, memory.file, detail});
}

uint64_t ObjectIdentity::unmapped(Unmapped kind, uint64_t first, uint64_t second) const {
    return _hash({static_cast<uint64_t>(kind), first, second, 0});
}

uint64_t ObjectIdentity::_hash(std::initializer_list<uint64_t> what) const {
    return bytes({reinterpret_cast<const char*>(what.begin()), what.size() * sizeof(uint64_t)});
}

uint64_t ObjectIdentity::bytes(std::string_view bytes) const {
    uint64_t hash = 0;
    crypto_shorthash(reinterpret_cast<unsigned char*>(&hash),
                     reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size(), _key.data());
    hash |= uint64_t{1} << 63U;
    return hash == UINT64_MAX ? hash - 1 : hash;
}
