#pragma once
// PELMORA_EXPORT marks the public surface of libpelmora: interfaces, factories, value types,
// exceptions and the free functions the headers declare. Everything else stays inside.

#define PELMORA_EXPORT __attribute__((visibility("default")))
