// One value per thread, made on first use and destroyed when its thread ends, for a module that
// must unload: a thread_local with a destructor makes glibc keep the module mapped after
// dlclose for as long as any thread that touched it lives. The slot's own destructor, run when
// the module unloads, destroys the values of the threads that are still alive.
#pragma once

#include <pthread.h>

#include <memory>
#include <mutex>
#include <unordered_set>

namespace platform {

template <typename T>
class ThreadSlot {
  public:
    ThreadSlot() : m_valid(pthread_key_create(&m_key, &ThreadEnded) == 0) {}
    ~ThreadSlot() {
        if (!m_valid) {
            return;
        }
        pthread_key_delete(m_key);
        std::unordered_set<Node*> left;
        {
            std::lock_guard<std::mutex> lock(m_mutex);
            left.swap(m_nodes);
        }
        for (Node* node : left) {
            delete node;
        }
    }
    ThreadSlot(const ThreadSlot&) = delete;
    ThreadSlot& operator=(const ThreadSlot&) = delete;

    // This thread's value, made on first use; null only when the slot could not be made.
    T* Get() {
        if (!m_valid) {
            return nullptr;
        }
        if (auto* node = static_cast<Node*>(pthread_getspecific(m_key))) {
            return &node->value;
        }
        auto node = std::make_unique<Node>(this);
        {
            std::lock_guard<std::mutex> lock(m_mutex);
            m_nodes.insert(node.get());
        }
        if (pthread_setspecific(m_key, node.get()) != 0) {
            std::lock_guard<std::mutex> lock(m_mutex);
            m_nodes.erase(node.get());
            return nullptr;
        }
        return &node.release()->value;
    }

  private:
    struct Node {
        explicit Node(ThreadSlot* slot) : owner(slot) {}
        ThreadSlot* owner;
        T value{};
    };

    static void ThreadEnded(void* pointer) {
        auto* node = static_cast<Node*>(pointer);
        bool owned = false;
        {
            std::lock_guard<std::mutex> lock(node->owner->m_mutex);
            owned = node->owner->m_nodes.erase(node) == 1;
        }
        if (owned) {
            delete node;
        }
    }

    pthread_key_t m_key{};
    bool m_valid;
    std::mutex m_mutex;
    std::unordered_set<Node*> m_nodes;
};

}  // namespace platform
