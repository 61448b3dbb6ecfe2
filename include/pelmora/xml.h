#pragma once
// The XML document model, its serialisers and simple paths, and the expat-based parser.

#include "pelmora/xml/node.h"
#include "pelmora/xml/parser.h"
