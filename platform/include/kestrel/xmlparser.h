// XML document base of the suite: loads an XML file into a DOM document for a derived reader,
// or builds one through a derived writer and stores it, on Xerces-C.
//
// Text is exchanged as narrow byte strings taken one byte per character (ISO-8859-1), so every
// byte string that XML 1.0 can hold round-trips exactly; documents are written in ISO-8859-1.
// Reading is safe on untrusted files: no external entity, DTD or network resource is fetched,
// entity expansion is bounded, no validation is done, and any parse error is thrown as a
// kestrel exception that names the file and the position of the error.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include <xercesc/util/XercesDefs.hpp>

#include <kestrel/export.h>
#include <kestrel/file.h>

XERCES_CPP_NAMESPACE_BEGIN
class DOMDocument;
class DOMDocumentType;
class DOMElement;
XERCES_CPP_NAMESPACE_END

namespace kestrel {

class KESTREL_API XMLParser {
  public:
    // Size of the buffer that the C-string form of ReadTagFromFile fills.
    static constexpr std::size_t kTagTextSize = 192;
    // Files larger than this are refused rather than read into memory.
    static constexpr unsigned long long kMaxFileBytes = 64ull << 20;

    XMLParser();
    explicit XMLParser(const char* xmlFilename);
    virtual ~XMLParser();
    XMLParser(const XMLParser&) = delete;
    XMLParser& operator=(const XMLParser&) = delete;

    void SetXMLFilename(std::string xmlFilename);
    std::string GetXMLFilename() const;

    // true: loads the named file and calls ReadXMLFile; false: calls WriteXMLFile, which builds
    // the document through the writing hooks and stores it in the named file. Exceptions of the
    // hooks pass out unchanged; the document lives only for the duration of the call.
    // Reading takes any file that can be read to its end (a pipe too) of at most kMaxFileBytes,
    // whose root element is named GetDocNameTag(). Writing replaces the file only once the
    // whole document has been written: a failure leaves the previous file as it was.
    virtual void Serialize(bool reading);

  protected:
    // Writing hooks. The document type may be null (no document type declaration); the base
    // takes a non-null one over, with the document it was made in (see KESTREL_XMLUtil).
    virtual XERCES_CPP_NAMESPACE::DOMDocumentType* GetDOMDocumenType() const;
    virtual std::string GetDocNameTag() const = 0;
    // Reading hook, called with the loaded document.
    virtual void ReadXMLFile() = 0;
    // Writing hook: adds the content below the root element.
    virtual void AddElementsToDocument() = 0;
    // Builds the document through the three writing hooks and stores it in the named file.
    virtual void WriteXMLFile();

    // Reading, from ReadXMLFile. Each tells whether the loaded document has an element of that
    // name anywhere below the root; the first such element in document order is the one read.
    // Its whole text content, of any length.
    bool ReadTagFromFile(const char* tag, std::string* text);
    // The same into a buffer of kTagTextSize bytes, NUL-terminated. A text that does not fit is
    // refused with DataException rather than cut.
    bool ReadTagFromFile(const char* tag, char* text);
    // The text contents of all elements of that name, appended in document order.
    bool ReadTagFromFile(const char* tag, std::vector<std::string>* texts);

    // Writing, from AddElementsToDocument. Appends to the root element a new element with the
    // text as content (none when text is null) and returns it.
    XERCES_CPP_NAMESPACE::DOMElement* AddElement(const std::string& tag, const char* text);
    // Appends to parent one element per text, in order, and returns them.
    std::vector<XERCES_CPP_NAMESPACE::DOMElement*> AddElements(
        XERCES_CPP_NAMESPACE::DOMElement* parent, const std::string& tag,
        const std::vector<std::string>& texts);

    // From a writing hook: a file that belongs with the XML file (its DTD), written and closed
    // but not yet in place. It is put in place once the XML file has been written completely,
    // just before the XML file replaces the previous one; when the writing fails it is dropped,
    // and when the XML file cannot be put in place it is removed again unless it replaced a
    // file that existed before.
    void KeepWithXMLFile(std::unique_ptr<core::fileio::ReplacingFile> file) const;

  private:
    class Session;
    struct DocumentRelease {
        void operator()(XERCES_CPP_NAMESPACE::DOMDocument* document) const;
    };
    using DocumentPtr = std::unique_ptr<XERCES_CPP_NAMESPACE::DOMDocument, DocumentRelease>;

    void LoadDocument();
    XERCES_CPP_NAMESPACE::DOMElement* Root(const char* operation) const;
    XERCES_CPP_NAMESPACE::DOMElement* NewElement(const std::string& tag, const char* text,
                                                 std::size_t length);

    // Keeps Xerces initialised for as long as the object lives; declared first so that it is
    // released last.
    std::unique_ptr<Session> session_;
    std::string xmlFilename_;
    DocumentPtr document_;
    mutable std::vector<std::unique_ptr<core::fileio::ReplacingFile>> companions_;
};

// Helpers of the XML base.
class KESTREL_API KESTREL_XMLUtil {
  public:
    // A document type node with these three values, for XMLParser to take as the result of
    // GetDOMDocumenType. It is made in a small document of its own (a node made apart from any
    // document would hold Xerces memory until Xerces stops), which goes with it: one that is not
    // handed over is released with type->getOwnerDocument()->release().
    static XERCES_CPP_NAMESPACE::DOMDocumentType* CreateDocumentType(const std::string& name,
                                                                     const std::string& publicId,
                                                                     const std::string& systemId);
};

}  // namespace kestrel
