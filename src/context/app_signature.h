// The installed-app signature: which whitelisted apps are on the device, as one bit each in a
// bitmap, run-length coded, checksummed and prefixed with the whitelist's version, in base64 text.
// The server decodes it bit for bit, so every layout detail below is part of the wire format.
//
// Signature bytes (before base64; multi-byte fields big-endian):
//   0..3   CRC-32 (zlib, initial 0) of bytes 4 to the end
//   4      second-to-last version byte, top bit replaced by the flag (1 run-length coded, 0 raw)
//   5      last version byte
//   6..7   bitmap length in bytes
//   8..11  bytes 12..15 of the MD5 digest of the uncompressed bitmap
//   12..   the payload: the run-length code (flag 1) or the raw bitmap (flag 0)
// Run-length code: R (2 bytes), R entries of "run length - 1", then ceil(R/8) bytes of run kinds
// (1 = a run of one-bits), most significant bit first, zero-padded.
//
// Everything here is a pure function: safe from any thread, no state, no logging.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tavix {

// The whitelist's identifier in the download manager's resource list (a bag key).
inline constexpr const char* kTVXInstalledAppWhitelist = "installed_app_whitelist";

// One installed application as the workspace reports it.
struct InstalledApp {
  std::string bundleIdentifier;
  std::string bundleVersion;
};

// The bitmap for `encodingIds`: ceil(largest id / 8.0) bytes, id k setting 0x80 >> (k % 8) of byte
// k / 8. An id that is a multiple of 8 and the largest falls one byte past the end and is left
// out: the server sizes the bitmap the same way, so this must not be "fixed".
std::vector<std::uint8_t> makeBitmap(const std::vector<std::uint32_t>& encodingIds);

// The encoder's running state: where the next entry and kind bit go.
struct RunWriter {
  std::vector<std::uint8_t> entries;
  std::vector<std::uint8_t> kinds;
  std::uint8_t kindByte = 0;
  unsigned kindBits = 0;
};

// Stores one run (its length - 1, and its kind bit), flushing the kind byte after 8 bits.
void saveRun(RunWriter& writer, std::uint8_t lengthMinusOne, bool ones);

// A byte's value rebuilt from its bits, bit 7 first: the decoder's single step.
std::uint8_t getRunLength(std::uint8_t byte);

// Codes `bitmap` (`length` bytes) into `out`, which must hold `length` bytes. Returns the flag: 1
// when the code is shorter than the bitmap (written to `out`), else 0 with the raw bitmap copied
// there. `*outLength` receives the payload's length.
int encodeRun(const std::uint8_t* bitmap, std::size_t length, std::uint8_t* out, std::size_t* outLength);

// The 4-byte digest tail, then encodeRun's payload, into `out` (room for length + 4 bytes).
// `*outLength` = payload length + 4. Returns the flag.
int rle_compress(const std::uint8_t* bitmap, std::size_t length, std::uint8_t* out, std::size_t* outLength);

// Reverses the run-length code into `out` (`length` bytes). False when the code is truncated,
// inconsistent, or does not fill exactly `length` bytes.
bool rle_expand(const std::uint8_t* code, std::size_t codeLength, std::uint8_t* out, std::size_t length);

// The base64 signature for a bitmap of `bitmapLength` bytes, given rle_compress's output (digest
// tail and payload) and flag. Empty when the version text is not an even number (at least 4) of
// hexadecimal digits, or the bitmap is too long for its 16-bit length field.
std::optional<std::string> makeSignature(std::size_t bitmapLength, const std::uint8_t* payloadWithDigest,
                                         std::size_t payloadLength, int flag, std::string_view version);

// The signature of the installed apps that `whitelist` (the whitelist resource's bytes) names.
// Empty when the whitelist is malformed, names none of `installed`, or its version is unusable;
// `why` (if given) then says which, for the caller's log line.
std::optional<std::string> processWhitelist(std::string_view whitelist, const std::vector<InstalledApp>& installed,
                                            std::string* why = nullptr);

}  // namespace tavix
