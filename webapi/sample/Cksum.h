// The checksum the sample library answers for files (upload, checksum task).
#pragma once

#include <cstddef>
#include <cstdint>

namespace Sample {

// CRC of POSIX cksum (polynomial 0x04C11DB7, most significant bit first,
// the length appended in as few bytes as it needs, least significant
// first, the result complemented): what `cksum` prints first.
class PosixCksum {
public:
    PosixCksum()
    {
        for (uint32_t i = 0; i < 256; ++i) {
            uint32_t c = i << 24;
            for (int bit = 0; bit < 8; ++bit) {
                c = (c & 0x80000000u) != 0 ? (c << 1) ^ 0x04C11DB7u : c << 1;
            }
            table_[i] = c;
        }
    }
    void Add(const unsigned char* p, size_t n)
    {
        for (size_t i = 0; i < n; ++i) {
            Byte(p[i]);
        }
        length_ += n;
    }
    uint32_t Finish()
    {
        for (unsigned long long n = length_; n != 0; n >>= 8) {
            Byte(static_cast<unsigned char>(n & 0xff));
        }
        return ~crc_;
    }
    unsigned long long Length() const { return length_; }

private:
    void Byte(unsigned char b) { crc_ = (crc_ << 8) ^ table_[((crc_ >> 24) ^ b) & 0xff]; }
    uint32_t table_[256];
    uint32_t crc_ = 0;
    unsigned long long length_ = 0;
};

}  // namespace Sample
