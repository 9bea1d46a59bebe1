// Byte-buffer and string helpers shared by changelogs, signed documents,
// preferences and the client registry. Integers are big-endian; strings in
// buffers are UTF-8 followed by one zero byte.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

// The four bytes at offset, big-endian. Raises NubiloCorruptChangelogException
// when they lie beyond the end of data.
VSM_EXPORT uint32_t NubiloUInt32AtOffset(vtc::ByteView data, uint32_t offset);
VSM_EXPORT void NubiloAppendUInt32(vtc::Bytes& data, uint32_t value);
// Appends the UTF-8 bytes and one zero byte.
VSM_EXPORT void NubiloAppendString(vtc::Bytes& data, std::string_view string);

// A reduced gzip envelope: the ten header bytes 1F 8B 08 00 00 00 00 00 00 03
// and a raw deflate stream, with no trailer. Nothing on failure.
VSM_EXPORT std::optional<vtc::Bytes> NubiloGzip(vtc::ByteView data);
// Inflates everything after the first ten bytes (never examined); bytes
// after the end of the deflate stream are ignored. Nothing on failure.
VSM_EXPORT std::optional<vtc::Bytes> NubiloCopyGunzip(vtc::ByteView data);
VSM_EXPORT std::optional<vtc::Bytes> NubiloGunzip(vtc::ByteView data);

// The property list (XML or binary) in data, or nothing.
VSM_EXPORT std::optional<vtc::Value> NubiloDictionaryWithData(vtc::ByteView data);

// The string without the characters of Unicode categories Cc and Cf.
VSM_EXPORT std::string NubiloStringByStrippingControlCharacters(std::string_view string);
