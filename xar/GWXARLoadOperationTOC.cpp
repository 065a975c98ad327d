// What the load does with a parsed table of contents before building its
// entries: the checksum and signature verdicts and the split-off subdocuments.

#include <cstring>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARLoadOperation.h"
#include "foundation/GWChecksum.h"

std::optional<GWXARFileArray> GWXARLoadOperation::parseTOC(pugi::xml_document& document,
                                                           int checksumAlgorithm,
                                                           bool failOnInvalidSignature,
                                                           GWErrorPtr* error) {
    pugi::xml_node root = document.document_element();
    if (std::strcmp(root.name(), "xar") != 0) {
        GWFail(error, errorWithDomain(kGWCocoaErrorDomain, GWFileReadCorruptFileError,
                                      std::string(root.name()), root));
        return std::nullopt;
    }
    const pugi::xml_node toc = root.child("toc");
    if (!toc) {
        GWFail(error, errorWithDomain(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt,
                                      root));
        return std::nullopt;
    }

    GWErrorPtr checksumFailure;
    if (verifyTOCChecksum(checksumAlgorithm, toc, &checksumFailure)) {
        checksumIsValid_ = true;
        checksumError_ = nullptr;
    } else if (failOnInvalidSignature) {
        GWFail(error, checksumFailure);
        return std::nullopt;
    } else {
        checksumIsValid_ = false;
        checksumError_ = checksumFailure;
    }

    if (!extractSubdocumentsFromRoot(root, error)) {
        return std::nullopt;
    }

    GWErrorPtr signatureFailure;
    if (verifySignaturesWithTOC(toc, checksumAlgorithm, &signatureFailure)) {
        // Verifying nothing succeeds, yet an unsigned archive is not validly signed.
        signatureIsValid_ = signatures() && !signatures()->empty();
        signatureError_ = nullptr;
    } else if (failOnInvalidSignature) {
        // Possibly no error object: the load then reports a general read error.
        GWFail(error, signatureFailure);
        return std::nullopt;
    } else {
        signatureIsValid_ = false;
        signatureError_ = signatureFailure;
    }

    return filesFromTOCElement(toc, error);
}

bool GWXARLoadOperation::verifyTOCChecksum(int algorithm, const pugi::xml_node& toc,
                                           GWErrorPtr* error) {
    auto invalid = [&] {
        return GWFail(error, errorWithCode(GWXARArchiveInvalidTOCChecksumError, std::nullopt, toc));
    };
    pugi::xml_node element;
    std::size_t count = 0;
    for (const pugi::xml_node& candidate : toc.children("checksum")) {
        if (count++ == 0) {
            element = candidate;
        }
    }
    if (count > 1) {
        return invalid();
    }
    if (algorithm == GWChecksumAlgorithmNone) {
        return count == 0 ? true : invalid();
    }
    if (count == 0) {
        return invalid();
    }
    int storedAlgorithm = GWChecksumAlgorithmUnknown;
    auto stored = checksumFromElement(element, &storedAlgorithm, error);
    if (!stored) {
        return false;
    }
    if (storedAlgorithm != algorithm || *stored != tocChecksum()) {
        return invalid();
    }
    return true;
}

bool GWXARLoadOperation::extractSubdocumentsFromRoot(pugi::xml_node root, GWErrorPtr* /*error*/) {
    std::vector<pugi::xml_node> subdocs;
    for (const pugi::xml_node& subdoc : root.children("subdoc")) {
        subdocs.push_back(subdoc);
    }
    if (subdocs.empty()) {
        return true;
    }
    GWXARSubdocuments subdocuments;
    for (const pugi::xml_node& subdoc : subdocs) {
        pugi::xml_node first;
        std::size_t elementCount = 0;
        for (const pugi::xml_node& child : subdoc.children()) {
            if (child.type() == pugi::node_element && elementCount++ == 0) {
                first = child;
            }
        }
        const std::string name = subdoc.attribute("subdoc_name").value();
        auto document = std::make_shared<pugi::xml_document>();
        // One element is the document's root; several keep their "subdoc" wrapper.
        const pugi::xml_node detached = elementCount == 1  ? first
                                        : elementCount > 1 ? subdoc
                                                           : pugi::xml_node();
        if (detached) {
            document->append_copy(detached);
            detached.parent().remove_child(detached);
        }
        subdocuments[name.empty() ? "subdoc" : name] = std::move(document);
    }
    subdocuments_ = std::move(subdocuments);
    return true;
}
