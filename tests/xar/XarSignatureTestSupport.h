#pragma once

#include <string>
#include <vector>

#include <pugixml.hpp>

#include "foundation/GWError.h"
#include "support/TestSupport.h"
#include "support/XarSigning.h"
#include "xar/GWXARLoadOperation.h"

namespace gwtest {

// The signing material of this test process, made once.
XarSigning& sharedSigning();

// A signature element to place in a table of contents: its bytes go to the heap.
struct TOCSignature {
    std::string style;
    GWData bytes;
    std::string keyInfoXML;
    bool extended = false;
};

// A table of contents holding `signatures` (and any `extraXML`), a heap file
// holding their bytes behind a few bytes of header, and a load operation
// reading that file with `checksum` as the table-of-contents checksum.
class SignedTOCFixture {
public:
    SignedTOCFixture(const std::vector<TOCSignature>& signatures, const GWData& checksum,
                     const std::string& extraXML = "");

    pugi::xml_node toc() const { return document_.child("xar").child("toc"); }
    GWXARLoadOperation& operation() { return *operation_; }
    // verifySignaturesWithTOC with the header's algorithm (a GWChecksum number).
    bool verify(GWErrorPtr* error, int checksumAlgorithm = 5);

private:
    TemporaryDirectory folder_;
    pugi::xml_document document_;
    GWXARLoadOperationPtr operation_;
};

// The XAR-domain detail texts of an error; "(no error)" without one.
std::string unknownEntity(const GWErrorPtr& error);
std::string affectedNode(const GWErrorPtr& error);

}  // namespace gwtest
