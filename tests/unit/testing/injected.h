// A function of a test in the place of a system call.
#pragma once

// Puts the function into the socket table for one test. A server that uses it is stopped first.
template <typename Function>
class Injected {
public:
    Injected(Function& entry, Function replacement) : m_entry(entry), m_before(entry) { entry = replacement; }
    ~Injected() { m_entry = m_before; }
    Injected(const Injected&) = delete;
    Injected& operator=(const Injected&) = delete;

private:
    Function& m_entry;
    Function m_before;
};
