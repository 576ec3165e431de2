#pragma once
// The active subscriptions of one member: an array that holds its first
// element in place. Nearly every member of a plant has one subscriber (the
// one server that serves it), which then costs no heap block of its own.
#include <cstdint>
#include <memory>

namespace cadrosim {

struct Subscription;

class SubscriberList {
public:
    SubscriberList() = default;
    SubscriberList(const SubscriberList &) = delete;
    SubscriberList &operator=(const SubscriberList &) = delete;

    Subscription **begin() { return Data(); }
    Subscription **end() { return Data() + m_size; }
    uint32_t size() const { return m_size; }
    bool empty() const { return m_size == 0; }
    Subscription *&operator[](uint32_t i) { return Data()[i]; }
    Subscription *&back() { return Data()[m_size - 1]; }
    void pop_back() { --m_size; }

    // Throws std::bad_alloc when it cannot grow, leaving the list unchanged.
    void push_back(Subscription *sub)
    {
        if (m_size == m_capacity)
            Grow();
        Data()[m_size++] = sub;
    }

private:
    Subscription **Data() { return m_more ? m_more.get() : &m_one; }
    void Grow()
    {
        auto more = std::make_unique<Subscription *[]>(m_capacity * 2);
        for (uint32_t i = 0; i < m_size; ++i)
            more[i] = Data()[i];
        m_more = std::move(more);
        m_capacity *= 2;
    }

    Subscription *m_one = nullptr;
    std::unique_ptr<Subscription *[]> m_more;
    uint32_t m_size = 0;
    uint32_t m_capacity = 1;
};

} // namespace cadrosim
