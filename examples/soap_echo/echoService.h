#pragma once
// The example's two operations in namespace "urn:anchor:echo": echoString (in -> out) and
// describePerson (a structured person -> one line of text).

#include "pelmora/soap.h"

namespace SoapEcho {

// Registers both operations with `map`.
void AddEchoHandlers(Pelmora::Soap::BodyHandlerMap* map);

}  // namespace SoapEcho
