#include "tools/frame_painter/png_writer.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstdlib>

namespace {

constexpr std::array<uint32_t, 256> make_crc_table() {
  std::array<uint32_t, 256> table{};
  for (uint32_t n = 0; n < 256; n++) {
    uint32_t c = n;
    for (int k = 0; k < 8; k++) c = (c & 1) ? 0xEDB88320u ^ (c >> 1) : c >> 1;
    table[n] = c;
  }
  return table;
}

constexpr std::array<uint32_t, 256> kCrcTable = make_crc_table();

void put_be32(std::vector<uint8_t>* out, uint32_t v) {
  out->push_back(static_cast<uint8_t>(v >> 24));
  out->push_back(static_cast<uint8_t>(v >> 16));
  out->push_back(static_cast<uint8_t>(v >> 8));
  out->push_back(static_cast<uint8_t>(v));
}

void put_le16(std::vector<uint8_t>* out, uint16_t v) {
  out->push_back(static_cast<uint8_t>(v));
  out->push_back(static_cast<uint8_t>(v >> 8));
}

void put_chunk(std::vector<uint8_t>* out, const char type[4], const std::vector<uint8_t>& data) {
  put_be32(out, static_cast<uint32_t>(data.size()));
  size_t type_at = out->size();
  out->insert(out->end(), type, type + 4);
  out->insert(out->end(), data.begin(), data.end());
  // The chunk CRC covers the type and the data, not the length.
  put_be32(out, png_crc32(0, out->data() + type_at, out->size() - type_at));
}

// Each deflate stored block holds at most 65535 bytes: its length field is 16 bits.
constexpr size_t kStoredMax = 65535;

std::vector<uint8_t> zlib_stored(const std::vector<uint8_t>& raw) {
  std::vector<uint8_t> z;
  z.reserve(raw.size() + raw.size() / kStoredMax * 5 + 16);
  // CMF 0x78 (deflate, 32K window), FLG 0x01: 0x7801 is a multiple of 31 as
  // the header check requires, no preset dictionary.
  z.push_back(0x78);
  z.push_back(0x01);
  size_t pos = 0;
  do {
    size_t len = raw.size() - pos;
    if (len > kStoredMax) len = kStoredMax;
    bool final = pos + len == raw.size();
    z.push_back(final ? 0x01 : 0x00);  // BFINAL, BTYPE 00 = stored
    put_le16(&z, static_cast<uint16_t>(len));
    put_le16(&z, static_cast<uint16_t>(~len));
    z.insert(z.end(), raw.begin() + static_cast<long>(pos),
             raw.begin() + static_cast<long>(pos + len));
    pos += len;
  } while (pos < raw.size());
  put_be32(&z, png_adler32(1, raw.data(), raw.size()));
  return z;
}

}  // namespace

uint32_t png_crc32(uint32_t crc, const uint8_t* data, size_t len) {
  uint32_t c = crc ^ 0xFFFFFFFFu;
  for (size_t i = 0; i < len; i++) c = kCrcTable[(c ^ data[i]) & 0xFF] ^ (c >> 8);
  return c ^ 0xFFFFFFFFu;
}

uint32_t png_adler32(uint32_t adler, const uint8_t* data, size_t len) {
  constexpr uint32_t kMod = 65521;
  uint32_t a = adler & 0xFFFF;
  uint32_t b = adler >> 16;
  while (len > 0) {
    // 5552 bytes is the longest run for which b cannot overflow 32 bits
    // before the modulo has to be taken.
    size_t run = len < 5552 ? len : 5552;
    len -= run;
    while (run-- > 0) {
      a += *data++;
      b += a;
    }
    a %= kMod;
    b %= kMod;
  }
  return (b << 16) | a;
}

std::vector<uint8_t> png_encode(const std::vector<uint8_t>& pixels, uint32_t width, uint32_t height,
                                PngColour colour) {
  size_t channels = colour == PngColour::kRgb ? 3 : 1;
  size_t row = static_cast<size_t>(width) * channels;
  if (width == 0 || height == 0 || pixels.size() != row * height) return {};

  std::vector<uint8_t> raw;
  raw.reserve((row + 1) * height);
  for (uint32_t y = 0; y < height; y++) {
    raw.push_back(0);  // filter type None
    raw.insert(raw.end(), pixels.begin() + static_cast<long>(y * row),
               pixels.begin() + static_cast<long>((y + 1) * row));
  }

  std::vector<uint8_t> out = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1A, '\n'};
  std::vector<uint8_t> ihdr;
  put_be32(&ihdr, width);
  put_be32(&ihdr, height);
  ihdr.push_back(8);                             // bit depth
  ihdr.push_back(static_cast<uint8_t>(colour));  // colour type
  ihdr.push_back(0);                             // compression: deflate
  ihdr.push_back(0);                             // filter method 0
  ihdr.push_back(0);                             // no interlace
  put_chunk(&out, "IHDR", ihdr);
  put_chunk(&out, "IDAT", zlib_stored(raw));
  put_chunk(&out, "IEND", {});
  return out;
}

int png_write_file(const std::string& path, const std::vector<uint8_t>& bytes) {
  std::string tmp = path + ".XXXXXX";
  std::vector<char> name(tmp.begin(), tmp.end());
  name.push_back('\0');
  // mkostemp creates with O_EXCL, so an existing name (or a link planted
  // under it) makes it pick another one instead of writing through it.
  int fd = mkostemp(name.data(), O_CLOEXEC);
  if (fd < 0) return errno;

  int err = 0;
  // mkostemp makes the file 0600; an image is for anyone the umask allows.
  mode_t mask = umask(0);
  umask(mask);
  if (fchmod(fd, 0666 & ~mask) != 0) err = errno;

  size_t done = 0;
  while (err == 0 && done < bytes.size()) {
    ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      err = errno;
    } else {
      done += static_cast<size_t>(n);
    }
  }
  if (close(fd) != 0 && err == 0) err = errno;
  if (err == 0 && rename(name.data(), path.c_str()) != 0) err = errno;
  if (err != 0) unlink(name.data());
  // A renderer killed between mkostemp and rename leaves "<name>.XXXXXX"
  // behind; it never carries the final name, so nothing mistakes it for a frame.
  return err;
}
