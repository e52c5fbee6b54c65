#pragma once

#include "check/Case.hpp"

/// @file
/// The cases for a server, one function for each family. A case is added here and nowhere else; docs/conformance.md is
/// printed from them.

namespace qel::tool::check {

/// All of them, in the order in which they run.
Cases serverCases();

Cases frameHeaderCases(); ///< frame/: header, lengths, pad
Cases frameStreamCases(); ///< frame/: split and joined frames, the end of the stream
Cases versionCases();
Cases sessionCases();
Cases requestCases();  ///< request/: which request is answered how, and what is ignored
Cases responseCases(); ///< response/: the exact form of each response
Cases capabilitiesCases();
Cases timeCases();
Cases modeCases();
Cases metadataCases();
Cases broadcastCases();
Cases serialCases();     ///< serial/: sessions
Cases serialDataCases(); ///< data/: what goes through sessions
Cases tlsCases();        ///< tls/: the steps to TLS
Cases plainCases();      ///< plain/: connections without TLS
Cases robustCases();

} // namespace qel::tool::check
