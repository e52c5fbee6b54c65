// A message class as a program defines it. This source is compiled, not run: one header of the library must be enough.
#include <qel/common/QelMessageMetadata.hpp>

namespace {

class OwnMessage : public qel::QelMessageMetadata<OwnMessage, qel::QelMessageFunctionQelKrog, qel::QelMessageOpRunMacro,
                                                  qel::QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;

protected:
    void pDerivedDebug(std::ostream& os) const override { os << "  Length: " << dataLength() << "\n"; }
};

// Instantiates what the class inherits.
[[maybe_unused]] OwnMessage ownMessage(const char* buffer, unsigned int length) { return {buffer, length}; }

} // namespace
