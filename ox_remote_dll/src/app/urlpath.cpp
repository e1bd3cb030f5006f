#include "app/urlpath.h"

#include <algorithm>

#include "platform/text.h"

bool oxUrlPath::Climbs() const {
    return m_path.find(CLIMB) != std::string_view::npos;
}

bool oxUrlPath::BeginsWith(std::string_view component) const {
    if (!m_path.starts_with('/') || !m_path.substr(1).starts_with(component))
        return false;
    const std::size_t end = 1 + component.size();
    return end == m_path.size() || m_path[end] == '/';
}

bool oxUrlPath::IsBelowTop() const {
    return std::count(m_path.begin(), m_path.end(), '/') > 1;
}

std::string oxUrlPath::Profile() const {
    const std::string_view rest = BehindFirst();
    if (rest.empty())
        return {};
    return std::string(rest.substr(1, rest.find('/', 1) - 1));
}

std::string_view oxUrlPath::BehindFirst() const {
    const std::size_t first = m_path.find('/');
    const std::size_t second = first == std::string_view::npos ? first : m_path.find('/', first + 1);
    return second == std::string_view::npos ? std::string_view() : m_path.substr(second);
}

bool oxUrlPath::FitsCommandLine() const {
    return std::none_of(m_path.begin(), m_path.end(), [](char c) { return c == ' ' || IsControl(c); });
}
