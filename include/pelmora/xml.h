#pragma once
// The XML document model, its serialisers and simple paths, the expat-based parser, and
// canonicalisation for signatures.

#include "pelmora/xml/node.h"
#include "pelmora/xml/parser.h"
#include "pelmora/xml/security/canonicalizer.h"
