// The XML parser's document limits as the configuration gives them.

#include "pelmora/service/config.h"
#include "pelmora/xml/parser.h"

namespace Pelmora::Service {

void LoadXmlDocLimits(Config::View* view) {
   Xml::DocLimits limits;
   view->Get("pelmora/xml/doc/maxChars", &limits.maxChars);
   view->Get("pelmora/xml/doc/maxNodes", &limits.maxNodes);
   view->Get("pelmora/xml/doc/maxDepth", &limits.maxDepth);
   Xml::SetDefaultDocLimits(limits);
}

}  // namespace Pelmora::Service
