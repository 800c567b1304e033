// Helpers of the tests that work on node stores and on the library's global
// registration state.
#pragma once

#include "TestSupport.h"

#include <IC/InstCtrl.h>
#include <IC/Node.h>
#include <IC/NodeStore.h>
#include <SD/Mutex.h>

namespace ictest {

// Registers the node through addNodeIfNew; true when it was new.
inline bool addNew(IC::NodeStore& store, IC::Node& node)
{
    IC::Node* p = &node;
    bool isNew = false;
    EXPECT_EQ(store.addNodeIfNew(p, isNew).getStatus(), 0);
    return isNew;
}

// ROOT 0 (id 1) with CPU 0..cpus-1 and then Fan 0..fans-1 below it (ids
// from 2 on), all registered in store.
struct NodeTree {
    NodeTree(IC::NodeStore& store, unsigned int cpus, unsigned int fans)
    {
        nodes.push_back(std::make_unique<IC::Node>(IC::Node::ROOT, 0, 1, 0, "root"));
        for (unsigned int i = 0; i < cpus + fans; ++i)
            nodes.push_back(std::make_unique<IC::Node>(i < cpus ? IC::Node::CPU : IC::Node::Fan,
                                                       i < cpus ? i : i - cpus, 2 + i, 1,
                                                       i < cpus ? "cpu" : "fan"));
        for (auto& n : nodes) {
            EXPECT_TRUE(addNew(store, *n));
            (n->getSensor() == IC::Node::CPU ? cpu : n->getSensor() == IC::Node::Fan ? fan : root)
                .push_back(n->getPath());
        }
    }
    std::vector<std::unique_ptr<IC::Node>> nodes;
    std::vector<std::string> root, cpu, fan; // paths
};

// Forgets every registration, node and asserted alert of the library.
inline void resetAlertState()
{
    namespace ICC = IC::InstCtrl;
    {
        SD::MutexGuard g(ICC::registerlock);
        for (auto& kv : ICC::callbacks)
            delete kv.second;
        ICC::callbacks.clear();
        ICC::nodepathTOalertregister.clear();
        ICC::sensortypeTOalertregister.clear();
        ICC::classtypeTOalertregister.clear();
        ICC::mysam.clear();
    }
    ICC::nodestore.clear();
    ICC::alertstore.clear();
}

// Resets the library's alert state when made and when gone: a fixture's
// first member, before anything that registers nodes.
struct CleanAlertState {
    CleanAlertState() { resetAlertState(); }
    ~CleanAlertState() { resetAlertState(); }
};

} // namespace ictest
