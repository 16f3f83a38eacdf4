#include <kestrel/xmlparser.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <new>
#include <system_error>
#include <utility>

#include <xercesc/dom/DOM.hpp>
#include <xercesc/framework/MemBufFormatTarget.hpp>
#include <xercesc/framework/MemBufInputSource.hpp>
#include <xercesc/framework/XMLAttr.hpp>
#include <xercesc/internal/XMLScanner.hpp>
#include <xercesc/parsers/XercesDOMParser.hpp>
#include <xercesc/sax/ErrorHandler.hpp>
#include <xercesc/sax/Locator.hpp>
#include <xercesc/sax/SAXParseException.hpp>
#include <xercesc/util/OutOfMemoryException.hpp>
#include <xercesc/util/PlatformUtils.hpp>
#include <xercesc/util/SecurityManager.hpp>
#include <xercesc/util/XMLEntityResolver.hpp>
#include <xercesc/util/XMLException.hpp>
#include <xercesc/util/XMLResourceIdentifier.hpp>
#include <xercesc/util/XMLUni.hpp>

#include <kestrel/disk.h>
#include <kestrel/exception.h>

namespace kestrel {

namespace xc = XERCES_CPP_NAMESPACE;

namespace {

using XString = std::basic_string<XMLCh>;

// Limits of reading. The documents of the suite need no user-declared entity (the predefined ones
// and character references do not count), so the expansion limit only has to let an odd
// hand-made file through while it stops the exponential kind at once; the text limit stops the
// quadratic kind (one large entity referenced many times), which stays under any count.
constexpr XMLSize_t kEntityExpansionLimit = 100;
constexpr unsigned long long kTextSlack = 1ull << 20;
constexpr unsigned long long kTextPerFileByte = 4;

// ---------------------------------------------------------------------------------------------
// Text: a narrow byte string is taken one byte per character (ISO-8859-1), both ways.

XString ToXML(const char* bytes, std::size_t length) {
    XString text(length, XMLCh(0));
    for (std::size_t i = 0; i < length; ++i) {
        text[i] = static_cast<XMLCh>(static_cast<unsigned char>(bytes[i]));
    }
    return text;
}

XString ToXML(const std::string& bytes) {
    return ToXML(bytes.data(), bytes.size());
}

// For messages only: characters beyond one byte become '?'.
std::string MessageText(const XMLCh* text) {
    std::string out;
    if (text == nullptr)
        return out;
    for (; *text != 0; ++text)
        out += *text <= 0xFF ? static_cast<char>(*text) : '?';
    return out;
}

// Whether XML 1.0 can hold the byte as a character (all but the C0 controls other than tab,
// line feed and carriage return).
bool IsXmlByte(unsigned char byte) {
    return byte >= 0x20 || byte == 0x09 || byte == 0x0A || byte == 0x0D;
}

// The system's text for an errno value.
std::string SystemReason(int error) {
    return error != 0 ? std::error_code(error, std::generic_category()).message()
                      : "reason unknown";
}

// Reports that an XML file cannot be read, written or created, with the reason given by Xerces
// or the system.
[[noreturn]] void ThrowFileError(const SourceLocation& where, const std::string& name,
                                 FileAccessException::Type type, const char* failure,
                                 const std::string& reason) {
    KESTREL_THROW_AT(where, FileAccessException, name, type,
                     FormatString("XML file %s %s: %s", name.c_str(), failure, reason.c_str()));
}

// ---------------------------------------------------------------------------------------------
// Xerces start-up and shut-down, counted over all objects of the process. Starting and stopping
// Xerces costs about ten times as much as reading a scene file, so the process itself holds one
// reference from the first use to its end: Xerces starts once and stops after the last object.

struct SessionState {
    std::mutex mutex;
    std::size_t count = 0;
};

SessionState& Sessions() {
    static SessionState state;
    return state;
}

void AddSessionReference() {
    SessionState& sessions = Sessions();
    std::lock_guard<std::mutex> lock(sessions.mutex);
    if (sessions.count == 0) {
        try {
            xc::XMLPlatformUtils::Initialize();
        } catch (const xc::XMLException& e) {
            KESTREL_THROW(Exception, FormatString("The XML library cannot be started: %s",
                                                  MessageText(e.getMessage()).c_str()));
        }
    }
    ++sessions.count;
}

void DropSessionReference() {
    SessionState& sessions = Sessions();
    std::lock_guard<std::mutex> lock(sessions.mutex);
    if (--sessions.count == 0)
        xc::XMLPlatformUtils::Terminate();
}

struct ProcessReference {
    ProcessReference() { AddSessionReference(); }
    ~ProcessReference() { DropSessionReference(); }
    ProcessReference(const ProcessReference&) = delete;
    ProcessReference& operator=(const ProcessReference&) = delete;
};

// Starts Xerces for the rest of the process, on the first call.
void HoldProcessSession() {
    static ProcessReference process;
}

// ---------------------------------------------------------------------------------------------
// Reading.

// A parse stops by this; LoadDocument turns it into a kestrel exception naming the file.
struct ParseFailure {
    std::string what;
    unsigned long long line;
    unsigned long long column;
};

class ThrowingErrorHandler : public xc::ErrorHandler {
  public:
    void warning(const xc::SAXParseException&) override {}
    void error(const xc::SAXParseException& e) override { Fail(e); }
    void fatalError(const xc::SAXParseException& e) override { Fail(e); }
    void resetErrors() override {}

  private:
    [[noreturn]] static void Fail(const xc::SAXParseException& e) {
        throw ParseFailure{MessageText(e.getMessage()),
                           static_cast<unsigned long long>(e.getLineNumber()),
                           static_cast<unsigned long long>(e.getColumnNumber())};
    }
};

// Refuses every external resource: entities, the external DTD subset, schemas.
class RefusingEntityResolver : public xc::XMLEntityResolver {
  public:
    xc::InputSource* resolveEntity(xc::XMLResourceIdentifier* resource) override {
        unsigned long long line = 0;
        unsigned long long column = 0;
        if (const xc::Locator* where = resource->getLocator()) {
            line = static_cast<unsigned long long>(where->getLineNumber());
            column = static_cast<unsigned long long>(where->getColumnNumber());
        }
        throw ParseFailure{FormatString("the external resource \"%s\" is not read",
                                        MessageText(resource->getSystemId()).c_str()),
                           line, column};
    }
};

// The DOM parser with a bound on the text that entity expansion can produce.
class BoundedDOMParser : public xc::XercesDOMParser {
  public:
    explicit BoundedDOMParser(unsigned long long maxTextChars) : maxTextChars_(maxTextChars) {}

    void docCharacters(const XMLCh* const chars, const XMLSize_t length,
                       const bool cdataSection) override {
        Count(length);
        xc::XercesDOMParser::docCharacters(chars, length, cdataSection);
    }

    void startElement(const xc::XMLElementDecl& elemDecl, const unsigned int urlId,
                      const XMLCh* const elemPrefix, const xc::RefVectorOf<xc::XMLAttr>& attrList,
                      const XMLSize_t attrCount, const bool isEmpty, const bool isRoot) override {
        for (XMLSize_t i = 0; i < attrCount; ++i) {
            Count(xc::XMLString::stringLen(attrList.elementAt(i)->getValue()));
        }
        xc::XercesDOMParser::startElement(elemDecl, urlId, elemPrefix, attrList, attrCount, isEmpty,
                                          isRoot);
    }

  private:
    void Count(XMLSize_t length) {
        textChars_ += length;
        if (textChars_ > maxTextChars_) {
            const xc::XMLScanner* scanner = getScanner();
            unsigned long long line = 0;
            unsigned long long column = 0;
            if (scanner != nullptr && scanner->getLocator() != nullptr) {
                line = static_cast<unsigned long long>(scanner->getLocator()->getLineNumber());
                column = static_cast<unsigned long long>(scanner->getLocator()->getColumnNumber());
            }
            throw ParseFailure{FormatString("entity expansion makes the document's text longer "
                                            "than %llu characters",
                                            maxTextChars_),
                               line, column};
        }
    }

    unsigned long long maxTextChars_;
    unsigned long long textChars_ = 0;
};

// The whole file as bytes.
std::vector<char> ReadBytes(const std::string& name, const SourceLocation& where) {
    errno = 0;
    std::FILE* file = std::fopen(name.c_str(), "rb");
    if (file == nullptr) {
        const int error = errno;
        if (DKCheck(name.c_str()) == 0) {
            KESTREL_THROW_AT(where, FileNotFoundException, name,
                             FormatString("XML file %s does not exist", name.c_str()));
        }
        ThrowFileError(where, name, FileAccessException::OpenFailed, "cannot be opened",
                       SystemReason(error));
    }
    std::vector<char> bytes;
    char chunk[65536];
    std::size_t got = 0;
    errno = 0;
    try {
        while ((got = std::fread(chunk, 1, sizeof chunk, file)) > 0) {
            bytes.insert(bytes.end(), chunk, chunk + got);
            if (bytes.size() > XMLParser::kMaxFileBytes) {
                KESTREL_THROW_AT(where, FileAccessException, name, FileAccessException::ReadFailed,
                                 FormatString("XML file %s is larger than %llu MiB, the most "
                                              "that is read; it is not read",
                                              name.c_str(), XMLParser::kMaxFileBytes >> 20));
            }
        }
    } catch (...) {
        std::fclose(file);
        throw;
    }
    const bool failed = std::ferror(file) != 0;
    const int error = errno;
    std::fclose(file);
    if (failed) {
        ThrowFileError(where, name, FileAccessException::ReadFailed, "cannot be read",
                       SystemReason(error));
    }
    return bytes;
}

// Appends the text of node and its descendants (text and CDATA sections, as DOM text content
// has it) as bytes. Returns the first character that has no single-byte form, or 0. Walks the
// tree without recursion, so that deeply nested input cannot exhaust the stack.
XMLCh AppendText(const xc::DOMNode* node, std::string* out) {
    const xc::DOMNode* current = node->getFirstChild();
    while (current != nullptr) {
        const xc::DOMNode::NodeType type = current->getNodeType();
        if (type == xc::DOMNode::TEXT_NODE || type == xc::DOMNode::CDATA_SECTION_NODE) {
            for (const XMLCh* c = current->getNodeValue(); c != nullptr && *c != 0; ++c) {
                if (*c > 0xFF)
                    return *c;
                out->push_back(static_cast<char>(*c));
            }
        } else if ((type == xc::DOMNode::ELEMENT_NODE ||
                    type == xc::DOMNode::ENTITY_REFERENCE_NODE) &&
                   current->getFirstChild() != nullptr) {
            current = current->getFirstChild();
            continue;
        }
        // Next in document order below node.
        while (current != nullptr && current->getNextSibling() == nullptr) {
            current = current->getParentNode();
            if (current == node)
                return 0;
        }
        if (current != nullptr)
            current = current->getNextSibling();
    }
    return 0;
}

// Calls visit(element) for each element named `name` below root, in document order, while
// visit returns true.
template <typename Visit>
void ForEachElementBelow(const xc::DOMElement* root, const XString& name, Visit visit) {
    const xc::DOMNode* node = root->getFirstChild();
    while (node != nullptr) {
        if (node->getNodeType() == xc::DOMNode::ELEMENT_NODE) {
            if (name == node->getNodeName() && !visit(static_cast<const xc::DOMElement*>(node))) {
                return;
            }
            if (const xc::DOMNode* child = node->getFirstChild()) {
                node = child;
                continue;
            }
        }
        // Next in document order: the next sibling of the node or of its nearest ancestor below
        // root that has one.
        while (node != nullptr && node->getNextSibling() == nullptr) {
            node = node->getParentNode();
            if (node == root)
                return;
        }
        if (node != nullptr)
            node = node->getNextSibling();
    }
}

[[noreturn]] void ThrowNoSingleByteForm(const std::string& file, const char* tag, XMLCh bad,
                                        const SourceLocation& where) {
    KESTREL_THROW_AT(where, DataException,
                     FormatString("XML file %s: the text of element %s holds the character "
                                  "U+%04X, which has no single-byte form",
                                  file.c_str(), tag, static_cast<unsigned int>(bad)));
}

// ---------------------------------------------------------------------------------------------
// Writing.

class RecordingDOMErrorHandler : public xc::DOMErrorHandler {
  public:
    bool handleError(const xc::DOMError& error) override {
        if (message.empty())
            message = MessageText(error.getMessage());
        return error.getSeverity() == xc::DOMError::DOM_SEVERITY_WARNING;
    }
    std::string message;
};

// Releases a document type node together with the document it was made in, if any.
struct TypeRelease {
    void operator()(xc::DOMDocumentType* type) const {
        if (type == nullptr)
            return;
        if (xc::DOMDocument* owner = type->getOwnerDocument())
            owner->release();
        else
            type->release();
    }
};

template <typename T>
struct XercesRelease {
    void operator()(T* object) const {
        if (object != nullptr)
            object->release();
    }
};
template <typename T>
using XercesPtr = std::unique_ptr<T, XercesRelease<T>>;

xc::DOMImplementation* Implementation() {
    static const XMLCh kFeatures[] = {'L', 'S', 0};
    return xc::DOMImplementationRegistry::getDOMImplementation(kFeatures);
}

// Puts every child element of an element that holds elements on a line of its own, indented by
// two blanks a level. Xerces' own pretty printing also puts blank lines around the root's
// children; these whitespace nodes give the same layout without them.
void IndentElements(xc::DOMDocument* document, xc::DOMElement* element, std::size_t depth) {
    if (element->getFirstElementChild() == nullptr)
        return;
    const XString inner = ToXML("\n" + std::string(2 * (depth + 1), ' '));
    for (xc::DOMElement* child = element->getFirstElementChild(); child != nullptr;
         child = child->getNextElementSibling()) {
        element->insertBefore(document->createTextNode(inner.c_str()), child);
        IndentElements(document, child, depth + 1);
    }
    element->appendChild(
        document->createTextNode(ToXML("\n" + std::string(2 * depth, ' ')).c_str()));
}

// The serialized document with the XML declaration and the document type declaration each on
// a line of its own, and a line end at the end.
std::string WithPrologLines(const char* bytes, std::size_t length) {
    std::string out(bytes, length);
    std::size_t pos = out.find("?>");
    if (pos != std::string::npos) {
        pos += 2;
        out.insert(pos, "\n");
        ++pos;
        if (out.compare(pos, 9, "<!DOCTYPE") == 0) {
            char quote = 0;
            for (std::size_t i = pos; i < out.size(); ++i) {
                const char c = out[i];
                if (quote != 0) {
                    if (c == quote)
                        quote = 0;
                } else if (c == '"' || c == '\'') {
                    quote = c;
                } else if (c == '>') {
                    out.insert(i + 1, "\n");
                    break;
                }
            }
        }
    }
    if (out.empty() || out.back() != '\n')
        out += '\n';
    return out;
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// Session.

class XMLParser::Session {
  public:
    Session() {
        HoldProcessSession();  // outlives every object made after it
        AddSessionReference();
    }
    ~Session() { DropSessionReference(); }
    Session(const Session&) = delete;
    Session& operator=(const Session&) = delete;
};

void XMLParser::DocumentRelease::operator()(xc::DOMDocument* document) const {
    if (document != nullptr)
        document->release();
}

// ---------------------------------------------------------------------------------------------
// XMLParser.

XMLParser::XMLParser() : session_(new Session) {}

XMLParser::XMLParser(const char* xmlFilename)
    : session_(new Session), xmlFilename_(xmlFilename != nullptr ? xmlFilename : "") {}

XMLParser::~XMLParser() {
    document_.reset();  // before the session ends
}

void XMLParser::SetXMLFilename(std::string xmlFilename) {
    xmlFilename_ = std::move(xmlFilename);
}

std::string XMLParser::GetXMLFilename() const {
    return xmlFilename_;
}

xc::DOMDocumentType* XMLParser::GetDOMDocumenType() const {
    return nullptr;
}

void XMLParser::Serialize(bool reading) {
    // The document lives only while the hooks run.
    struct Drop {
        DocumentPtr& document;
        ~Drop() { document.reset(); }
    } drop{document_};
    if (reading) {
        LoadDocument();
        ReadXMLFile();
    } else {
        WriteXMLFile();
    }
}

void XMLParser::LoadDocument() {
    document_.reset();
    const std::string& name = xmlFilename_;
    if (name.empty()) {
        KESTREL_THROW(FileNotFoundException, name, "No XML file name was given to read");
    }
    const std::vector<char> bytes = ReadBytes(name, KESTREL_HERE);

    const unsigned long long maxText =
        kTextSlack + kTextPerFileByte * static_cast<unsigned long long>(bytes.size());
    BoundedDOMParser parser(maxText);
    ThrowingErrorHandler errors;
    RefusingEntityResolver resolver;
    xc::SecurityManager security;
    security.setEntityExpansionLimit(kEntityExpansionLimit);
    parser.setValidationScheme(xc::XercesDOMParser::Val_Never);
    parser.setDoNamespaces(false);
    parser.setDoSchema(false);
    parser.setLoadSchema(false);
    parser.setLoadExternalDTD(false);
    parser.setDisableDefaultEntityResolution(true);
    parser.setXMLEntityResolver(&resolver);
    parser.setErrorHandler(&errors);
    parser.setSecurityManager(&security);
    parser.setCreateEntityReferenceNodes(false);
    parser.setCreateCommentNodes(false);

    static const XMLCh kSourceId[] = {'x', 'm', 'l', 0};
    xc::MemBufInputSource source(reinterpret_cast<const XMLByte*>(bytes.data()), bytes.size(),
                                 kSourceId, false);
    try {
        parser.parse(source);
    } catch (const ParseFailure& failure) {
        ThrowFileError(KESTREL_HERE, name, FileAccessException::ReadFailed, "cannot be read",
                       FormatString("line %llu, column %llu: %s", failure.line, failure.column,
                                    failure.what.c_str()));
    } catch (const xc::OutOfMemoryException&) {
        throw std::bad_alloc();
    } catch (const xc::XMLException& e) {
        ThrowFileError(KESTREL_HERE, name, FileAccessException::ReadFailed, "cannot be read",
                       MessageText(e.getMessage()));
    } catch (const xc::DOMException& e) {
        ThrowFileError(KESTREL_HERE, name, FileAccessException::ReadFailed, "cannot be read",
                       MessageText(e.getMessage()));
    }
    document_.reset(parser.adoptDocument());
    if (!document_ || document_->getDocumentElement() == nullptr) {
        document_.reset();
        KESTREL_THROW(FileAccessException, name, FileAccessException::ReadFailed,
                      FormatString("XML file %s has no root element", name.c_str()));
    }
    // A document of another kind is not read as one of this kind.
    const std::string expected = GetDocNameTag();
    const XString expectedName = ToXML(expected);
    if (!xc::XMLString::equals(document_->getDocumentElement()->getTagName(),
                               expectedName.c_str())) {
        const std::string root = MessageText(document_->getDocumentElement()->getTagName());
        document_.reset();
        ThrowFileError(
            KESTREL_HERE, name, FileAccessException::ReadFailed, "cannot be read",
            FormatString("its root element is \"%s\", not \"%s\"", root.c_str(), expected.c_str()));
    }
}

xc::DOMElement* XMLParser::Root(const char* operation) const {
    xc::DOMElement* root = document_ ? document_->getDocumentElement() : nullptr;
    if (root == nullptr) {
        KESTREL_THROW(Exception,
                      FormatString("%s is called without an XML document: use it from the "
                                   "reading or writing hooks only",
                                   operation));
    }
    return root;
}

bool XMLParser::ReadTagFromFile(const char* tag, std::string* text) {
    const XString name = ToXML(tag, std::strlen(tag));
    const xc::DOMElement* found = nullptr;
    ForEachElementBelow(Root("ReadTagFromFile"), name, [&found](const xc::DOMElement* element) {
        found = element;
        return false;
    });
    if (found == nullptr)
        return false;
    std::string content;
    const XMLCh bad = AppendText(found, &content);
    if (bad != 0)
        ThrowNoSingleByteForm(xmlFilename_, tag, bad, KESTREL_HERE);
    *text = std::move(content);
    return true;
}

bool XMLParser::ReadTagFromFile(const char* tag, char* text) {
    std::string content;
    if (!ReadTagFromFile(tag, &content))
        return false;
    if (content.size() >= kTagTextSize) {
        KESTREL_THROW(
            DataException,
            FormatString("XML file %s: the text of element %s is %llu bytes long; at "
                         "most %llu fit",
                         xmlFilename_.c_str(), tag, static_cast<unsigned long long>(content.size()),
                         static_cast<unsigned long long>(kTagTextSize - 1)));
    }
    std::memcpy(text, content.c_str(), content.size() + 1);
    return true;
}

bool XMLParser::ReadTagFromFile(const char* tag, std::vector<std::string>* texts) {
    const XString name = ToXML(tag, std::strlen(tag));
    bool any = false;
    ForEachElementBelow(Root("ReadTagFromFile"), name, [&](const xc::DOMElement* element) {
        std::string content;
        const XMLCh bad = AppendText(element, &content);
        if (bad != 0)
            ThrowNoSingleByteForm(xmlFilename_, tag, bad, KESTREL_HERE);
        texts->push_back(std::move(content));
        any = true;
        return true;
    });
    return any;
}

xc::DOMElement* XMLParser::NewElement(const std::string& tag, const char* text,
                                      std::size_t length) {
    for (std::size_t i = 0; i < length; ++i) {
        const unsigned char byte = static_cast<unsigned char>(text[i]);
        if (!IsXmlByte(byte)) {
            KESTREL_THROW(
                DataException,
                FormatString("XML file %s: the text of element %s holds the byte 0x%02X "
                             "at offset %llu, which XML cannot hold",
                             xmlFilename_.c_str(), tag.c_str(), static_cast<unsigned int>(byte),
                             static_cast<unsigned long long>(i)));
        }
    }
    try {
        xc::DOMElement* element = document_->createElement(ToXML(tag).c_str());
        if (text != nullptr) {
            element->appendChild(document_->createTextNode(ToXML(text, length).c_str()));
        }
        return element;
    } catch (const xc::DOMException& e) {
        KESTREL_THROW(DataException, FormatString("XML file %s: element %s cannot be made: %s",
                                                  xmlFilename_.c_str(), tag.c_str(),
                                                  MessageText(e.getMessage()).c_str()));
    }
}

xc::DOMElement* XMLParser::AddElement(const std::string& tag, const char* text) {
    xc::DOMElement* root = Root("AddElement");
    xc::DOMElement* element = NewElement(tag, text, text != nullptr ? std::strlen(text) : 0);
    root->appendChild(element);
    return element;
}

std::vector<xc::DOMElement*> XMLParser::AddElements(xc::DOMElement* parent, const std::string& tag,
                                                    const std::vector<std::string>& texts) {
    Root("AddElements");
    if (parent == nullptr || parent->getOwnerDocument() != document_.get()) {
        KESTREL_THROW(Exception, FormatString("AddElements is given no element of the document "
                                              "being written to %s",
                                              xmlFilename_.c_str()));
    }
    std::vector<xc::DOMElement*> added;
    added.reserve(texts.size());
    for (const std::string& text : texts) {
        xc::DOMElement* element = NewElement(tag, text.c_str(), text.size());
        parent->appendChild(element);
        added.push_back(element);
    }
    return added;
}

void XMLParser::WriteXMLFile() {
    const std::string& name = xmlFilename_;
    if (name.empty()) {
        KESTREL_THROW(FileAccessException, name, FileAccessException::CreateFailed,
                      "No XML file name was given to write");
    }
    document_.reset();
    // Companions kept by the hooks live only for this writing; those not put in place are
    // removed.
    struct DropCompanions {
        std::vector<std::unique_ptr<core::fileio::ReplacingFile>>& companions;
        ~DropCompanions() { companions.clear(); }
    } dropCompanions{companions_};
    companions_.clear();

    xc::DOMImplementation* implementation = Implementation();
    std::unique_ptr<xc::DOMDocumentType, TypeRelease> type(GetDOMDocumenType());
    const XString rootName = ToXML(GetDocNameTag());
    try {
        document_.reset(implementation->createDocument(nullptr, rootName.c_str(), nullptr));
        if (type) {
            // A copy made by the document itself lives in the document's memory; a node made
            // apart from any document would stay in Xerces' memory until Xerces stops.
            xc::DOMDocumentType* own = document_->createDocumentType(
                type->getName(), type->getPublicId(), type->getSystemId());
            document_->insertBefore(own, document_->getDocumentElement());
        }
    } catch (const xc::DOMException& e) {
        KESTREL_THROW(DataException,
                      FormatString("XML file %s: the document cannot be made: %s", name.c_str(),
                                   MessageText(e.getMessage()).c_str()));
    }
    type.reset();

    AddElementsToDocument();
    IndentElements(document_.get(), document_->getDocumentElement(), 0);

    RecordingDOMErrorHandler errors;
    xc::MemBufFormatTarget target;
    try {
        XercesPtr<xc::DOMLSSerializer> serializer(implementation->createLSSerializer());
        xc::DOMConfiguration* config = serializer->getDomConfig();
        config->setParameter(xc::XMLUni::fgDOMErrorHandler, &errors);
        config->setParameter(xc::XMLUni::fgDOMWRTFormatPrettyPrint, false);
        config->setParameter(xc::XMLUni::fgDOMXMLDeclaration, true);
        static const XMLCh kLineFeed[] = {'\n', 0};
        serializer->setNewLine(kLineFeed);
        XercesPtr<xc::DOMLSOutput> output(implementation->createLSOutput());
        const XString encoding = ToXML(std::string("ISO-8859-1"));
        output->setEncoding(encoding.c_str());
        output->setByteStream(&target);
        if (!serializer->write(document_.get(), output.get())) {
            ThrowFileError(KESTREL_HERE, name, FileAccessException::WriteFailed,
                           "cannot be written", errors.message);
        }
    } catch (const xc::OutOfMemoryException&) {
        throw std::bad_alloc();
    } catch (const xc::XMLException& e) {
        ThrowFileError(KESTREL_HERE, name, FileAccessException::WriteFailed, "cannot be written",
                       MessageText(e.getMessage()));
    } catch (const xc::DOMException& e) {
        ThrowFileError(KESTREL_HERE, name, FileAccessException::WriteFailed, "cannot be written",
                       MessageText(e.getMessage()));
    }

    // Written beside the file and put in place only when complete, so that a failure leaves the
    // previous file (and no companion of this writing) behind.
    const std::string text = WithPrologLines(reinterpret_cast<const char*>(target.getRawBuffer()),
                                             static_cast<std::size_t>(target.getLen()));
    core::fileio::ReplacingFile out(name, KESTREL_HERE);
    out.Write(text);
    out.Close();
    std::vector<std::string> placed;  // companions that did not exist before
    try {
        for (const auto& companion : companions_) {
            const bool existed = core::fileio::File(companion->GetTarget()).Exists();
            companion->Commit();
            if (!existed)
                placed.push_back(companion->GetTarget());
        }
        out.Commit();
    } catch (...) {
        for (const std::string& path : placed)
            std::remove(path.c_str());
        throw;
    }
}

void XMLParser::KeepWithXMLFile(std::unique_ptr<core::fileio::ReplacingFile> file) const {
    if (file)
        companions_.push_back(std::move(file));
}

// ---------------------------------------------------------------------------------------------
// KESTREL_XMLUtil.

xc::DOMDocumentType* KESTREL_XMLUtil::CreateDocumentType(const std::string& name,
                                                         const std::string& publicId,
                                                         const std::string& systemId) {
    HoldProcessSession();
    try {
        XercesPtr<xc::DOMDocument> holder(Implementation()->createDocument());
        xc::DOMDocumentType* type = holder->createDocumentType(
            ToXML(name).c_str(), ToXML(publicId).c_str(), ToXML(systemId).c_str());
        holder.release();  // released with the node by whoever takes it
        return type;
    } catch (const xc::DOMException& e) {
        KESTREL_THROW(DataException,
                      FormatString("Document type %s cannot be made: %s", name.c_str(),
                                   MessageText(e.getMessage()).c_str()));
    }
}

}  // namespace kestrel
