// The archive's text form, keyed persistence and deep copy.

#include <sstream>

#include "GWXARArchive.h"
#include "GWXARDescribing.h"
#include "foundation/GWFormat.h"

namespace {

const char* const kRefKey = "GWRef";
const char* const kFilesKey = "Files";
const char* const kSubdocumentsKey = "Subdocuments";
const char* const kTOCChecksumKey = "TOCChecksum";
const char* const kChecksumIsValidKey = "ChecksumIsValid";
const char* const kChecksumValidationErrorKey = "ChecksumValidationError";
const char* const kSignaturesKey = "Signatures";
const char* const kSignatureIsValidKey = "SignatureIsValid";
const char* const kSignatureValidationErrorKey = "SignatureValidationError";

// Subdocuments are kept as their XML text: any reader of the archive can use it.
GWDictionary subdocumentTexts(const GWXARSubdocuments& subdocuments) {
    GWDictionary texts;
    for (const auto& [name, document] : subdocuments) {
        std::ostringstream stream;
        if (document) {
            document->save(stream, "", pugi::format_raw | pugi::format_no_declaration);
        }
        texts[name] = stream.str();
    }
    return texts;
}

// Texts that are not XML are dropped rather than failing the whole archive.
GWXARSubdocuments subdocumentsFromTexts(const GWDictionary& texts) {
    GWXARSubdocuments subdocuments;
    for (const auto& [name, value] : texts) {
        const std::string* text = value.string();
        if (!text) {
            continue;
        }
        auto document = std::make_shared<pugi::xml_document>();
        if (!text->empty() && !document->load_buffer(text->data(), text->size(),
                                                     GWXARLoadOperation::kTOCParseOptions)) {
            continue;
        }
        subdocuments[name] = std::move(document);
    }
    return subdocuments;
}

GWXARSubdocuments copiedSubdocuments(const GWXARSubdocuments& subdocuments) {
    GWXARSubdocuments copies;
    for (const auto& [name, document] : subdocuments) {
        auto copy = std::make_shared<pugi::xml_document>();
        if (document) {
            copy->reset(*document);
        }
        copies[name] = std::move(copy);
    }
    return copies;
}

}  // namespace

std::string GWXARArchive::description() const {
    const GWXARFileArray top = files();
    std::string text =
        GWFormat("<%s %s files={", className().c_str(), GWXARDescribing::pointerText(this).c_str());
    for (std::size_t index = 0; index < top.size(); ++index) {
        text += "\n" + (top[index] ? top[index]->description() : std::string("(null)"));
        if (index + 1 < top.size()) {
            text += ",";
        }
    }
    return GWXARDescribing::indented(text) + "\n}>";
}

void GWXARArchive::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    coder.encodeObject(ref(), kRefKey);
    coder.encodeArrayOfObjects(files(), kFilesKey);
    const GWXARSubdocuments documents = subdocuments();
    if (!documents.empty()) {
        coder.encodeValue(GWValue(subdocumentTexts(documents)), kSubdocumentsKey);
    }
    coder.encodeValue(GWValue(tocChecksum()), kTOCChecksumKey);
    coder.encodeBool(checksumIsValid(), kChecksumIsValidKey);
    coder.encodeError(checksumValidationError(), kChecksumValidationErrorKey);
    coder.encodeArrayOfObjects(signatures(), kSignaturesKey);
    coder.encodeBool(privateSignatureIsValid(), kSignatureIsValidKey);
    coder.encodeError(privateSignatureValidationError(), kSignatureValidationErrorKey);
}

GWXARArchivePtr GWXARArchive::initWithCoder(GWCoder& coder) {
    if (!coder.allowsKeyedCoding()) {
        return nullptr;
    }
    auto archive = std::make_shared<GWXARArchive>();
    archive->ref_ = coder.decodeObjectOfClass<GWRef>(kRefKey);
    archive->files_ =
        coder.decodeArrayOfObjectsOfClass<GWXARFile>(kFilesKey).value_or(GWXARFileArray{});
    if (auto texts = coder.decodeDictionary(kSubdocumentsKey)) {
        archive->subdocuments_ = subdocumentsFromTexts(*texts);
    }
    archive->tocChecksum_ = coder.decodeData(kTOCChecksumKey).value_or(GWData{});
    archive->checksumIsValid_ = coder.decodeBool(kChecksumIsValidKey);
    archive->checksumValidationError_ = coder.decodeError(kChecksumValidationErrorKey);
    archive->signatures_ = coder.decodeArrayOfObjectsOfClass<GWXARSignature>(kSignaturesKey)
                               .value_or(GWXARSignatureArray{});
    archive->privateSignatureIsValid_ = coder.decodeBool(kSignatureIsValidKey);
    archive->privateSignatureValidationError_ = coder.decodeError(kSignatureValidationErrorKey);
    // Children find the archive through their parents.
    for (const auto& file : archive->files_) {
        file->setArchive(archive);
    }
    fixHardLinksInFiles(archive->files_);
    return archive;
}

GWXARArchivePtr GWXARArchive::copy() const {
    auto archive = init();
    std::lock_guard<std::mutex> lock(mutex_);
    archive->ref_ = ref_ ? ref_->copy() : nullptr;
    archive->subdocuments_ = copiedSubdocuments(subdocuments_);
    archive->tocChecksum_ = tocChecksum_;
    archive->checksumIsValid_ = checksumIsValid_.load();
    archive->checksumValidationError_ = checksumValidationError_;
    archive->signatures_.reserve(signatures_.size());
    for (const auto& signature : signatures_) {
        if (signature) {
            archive->signatures_.push_back(signature->copy());
        }
    }
    archive->privateSignatureIsValid_ = privateSignatureIsValid_.load();
    archive->privateSignatureValidationError_ = privateSignatureValidationError_;
    archive->files_.reserve(files_.size());
    for (const auto& file : files_) {
        if (file) {
            archive->files_.push_back(file->copy());
        }
    }
    setArchiveReferencesInFiles(archive->files_, archive);
    fixHardLinksInFiles(archive->files_);
    return archive;
}
