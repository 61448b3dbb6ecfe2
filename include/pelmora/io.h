#pragma once
// Readers and writers.

#include "pelmora/io/gzip.h"
#include "pelmora/io/readerWriter.h"
#include "pelmora/io/readers.h"
#include "pelmora/io/writers.h"
