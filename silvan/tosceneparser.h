// The scene description: one scene's rasters, math-model segment, no-data values and footprint,
// read from and written to an XML file of type TOSceneDesc_Document with its DTD beside it.
// The format is described in docs/scene.md.
#pragma once

#include <memory>
#include <string>

#include <kestrel/exception.h>
#include <kestrel/xmlparser.h>
#include <silvan/export.h>
#include <silvan/polygon.h>

namespace kestrel {
namespace processes {
namespace silvan {

class SILVAN_API TOSceneParser : public XMLParser {
  public:
    // An empty scene (the defaults of Init) without a file name.
    TOSceneParser();
    // Reads the scene of the file. Throws what loading throws (FileNotFoundException,
    // FileAccessException for a file that is not well-formed XML), FileAccessException " Error
    // in parsing %s XML file. Some tags are missing.\n" when a required element is missing, and
    // DataException for a footprint point without two coordinates.
    explicit TOSceneParser(const char* xmlFilename);
    ~TOSceneParser() override;
    TOSceneParser(const TOSceneParser&) = delete;
    TOSceneParser& operator=(const TOSceneParser&) = delete;

    // Every member back to its default; a held footprint is released.
    void Init();

    std::string GetSceneFilename() const { return sceneFilename; }
    void SetSceneFilename(const std::string& name) { sceneFilename = name; }
    std::string GetOrthoFilename() const { return orthoFilename; }
    void SetOrthoFilename(const std::string& name) { orthoFilename = name; }
    std::string GetVisIdxFilename() const { return visIdxFilename; }
    void SetVisIdxFilename(const std::string& name) { visIdxFilename = name; }
    std::string GetElevMapFilename() const { return elevMapFilename; }
    void SetElevMapFilename(const std::string& name) { elevMapFilename = name; }
    int GetMmseg() const { return mmseg; }
    void SetMmseg(int value) { mmseg = value; }
    float GetOrthoNoDataValue() const { return orthoNoDataValue; }
    void SetOrthoNoDataValue(float value) { orthoNoDataValue = value; }
    float GetElevNoDataValue() const { return elevNoDataValue; }
    void SetElevNoDataValue(float value) { elevNoDataValue = value; }

    // The held footprint, or null. The object keeps it; the pointer is valid until the footprint
    // is next replaced or the object is destroyed.
    kestrel::tin::Polygon<double>* GetSceneFootprint() const { return sceneFootprint.get(); }
    // Holds a copy of *footprint (which may be the polygon held already). Throws DataException
    // for a null argument.
    void SetSceneFootprint(const kestrel::tin::Polygon<double>* footprint);

  private:
    XERCES_CPP_NAMESPACE::DOMDocumentType* GetDOMDocumenType() const override;
    std::string GetDocNameTag() const override;
    void ReadXMLFile() override;
    void AddElementsToDocument() override;

    // Writes the DTD into directory, which ends in a path separator.
    void CreateDTDFile(const std::string& directory) const;

    bool GetSceneFilenameFromXML();
    bool GetOrthoFilenameFromXML();
    bool GetVisIdxFilenameFromXML();
    bool GetElevMapFilenameFromXML();
    bool GetMmsegFromXML();
    bool GetOrthoNoDataValueFromXML();
    bool GetElevNoDataValueFromXML();
    bool GetSceneFootprintFromXML();

    std::string sceneFilename;
    std::string orthoFilename;
    std::string visIdxFilename;
    std::string elevMapFilename;
    int mmseg;
    float orthoNoDataValue;
    float elevNoDataValue;
    std::unique_ptr<kestrel::tin::Polygon<double>> sceneFootprint;
};

}  // namespace silvan
}  // namespace processes
}  // namespace kestrel
