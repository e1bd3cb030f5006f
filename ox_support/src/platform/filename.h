// A path taken apart: directory, name, extension.
#pragma once

#include <string>
#include <string_view>

// "/opt/v1.2/ox_remote.bin" has the directory "/opt/v1.2", the file name "ox_remote.bin", the name "ox_remote" and the
// extension "bin". The extension is what follows the last "." of the file name, so a dot in a directory never
// counts. A leading dot begins the extension too: ".htm" has an empty name and the extension "htm".
class oxFilename {
public:
    oxFilename() = default;
    explicit oxFilename(std::string_view path);
    oxFilename(std::string_view directory, std::string_view fileName);

    const std::string& Directory() const { return m_directory; }  // without a final "/"; "/" for the root
    const std::string& Name() const { return m_name; }
    const std::string& Extension() const { return m_extension; }  // without the dot
    std::string FileName() const;                                 // name, dot and extension
    std::string Path() const;

    void SetDirectory(std::string_view directory);
    // An empty extension takes the dot away as well.
    void SetExtension(std::string_view extension);

    // directory + "/" + name, with exactly one "/" between them; an empty directory adds nothing.
    static std::string Join(std::string_view directory, std::string_view name);
    // "\" becomes "/", "//" and inner "/./" collapse, a final "/" or "/." goes. A leading "./" stays and none is added;
    // ".." is left alone.
    static std::string NormalizePath(std::string_view path);

private:
    std::string m_directory;
    std::string m_name;
    std::string m_extension;
    bool m_hasDot = false;
};
