/// PNG encoding without a compression library.
///
/// The image data goes into the zlib stream as stored (uncompressed) deflate
/// blocks: files are larger than a compressing encoder would make them, but
/// every viewer reads them and the encoder stays small enough to check by
/// eye. CRC-32 and Adler-32 are computed here.
///
/// Calling order: fill a pixel buffer row by row (`width * channels` bytes a
/// row, no padding), call `png_encode`, then `png_write_file` (or write the
/// bytes yourself).
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

enum class PngColour : uint8_t { kGrey = 0, kRgb = 2 };

/// CRC-32 as PNG chunks use it (polynomial 0xEDB88320, pre- and
/// post-inverted). `crc` is the running value; start with 0.
uint32_t png_crc32(uint32_t crc, const uint8_t* data, size_t len);
/// Adler-32 as zlib streams end with; start with 1.
uint32_t png_adler32(uint32_t adler, const uint8_t* data, size_t len);

/// The whole PNG file for 8-bit `pixels` of the given size and colour type.
/// `pixels` must hold exactly width * height * channels bytes (1 for grey,
/// 3 for RGB); returns an empty vector when it does not or a side is 0.
std::vector<uint8_t> png_encode(const std::vector<uint8_t>& pixels, uint32_t width, uint32_t height,
                                PngColour colour);

/// Writes `bytes` to `path` so that the name never shows a half-written file:
/// a fresh temporary file beside it (created exclusively, so a planted link
/// is never followed), then a rename over the final name. Returns 0, or an
/// errno value describing the first failure (the temporary is removed).
[[nodiscard]] int png_write_file(const std::string& path, const std::vector<uint8_t>& bytes);
