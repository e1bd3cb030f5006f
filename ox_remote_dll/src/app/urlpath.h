// The parts of a URL path that routing decides by.
#pragma once

#include <string>
#include <string_view>

// Positions are exact: no component is skipped, so "/reports//P/x.htm" asks for the profile "". What is decided here
// and what the file system opens must be the same component. Refers to the path it is given.
class oxUrlPath {
public:
    explicit oxUrlPath(std::string_view path) : m_path(path) {}

    static constexpr const char* CLIMB = "../";

    // CLIMB anywhere.
    bool Climbs() const;
    // Whether the first component is this one.
    bool BeginsWith(std::string_view component) const;
    // Anything below the top directory.
    bool IsBelowTop() const;
    // What follows the second "/", up to the next; empty when there is none.
    std::string Profile() const;
    // What follows the first component, with its "/".
    std::string_view BehindFirst() const;
    // Blanks and control characters would come apart in the engine's command line.
    bool FitsCommandLine() const;

private:
    std::string_view m_path;
};
