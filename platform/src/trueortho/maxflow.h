// Minimum s-t cut of a sparse graph by augmenting paths found in two search trees that are
// kept between augmentations (Boykov and Kolmogorov, 2004): fast on the grid graphs of image
// labelling, where most paths are short.
#pragma once

#include <kestrel/export.h>

#include <cstddef>
#include <cstdint>
#include <vector>

namespace kestrel {
namespace processes {
namespace trueortho {

class KESTREL_API MaxFlow {
  public:
    using Capacity = float;

    // Empties the graph and makes room for `nodes` nodes and `edges` edges (a hint).
    void Reset(int nodes, std::size_t edges);

    // Adds to the cost of the node ending on the source side (costSource) and on the sink side
    // (costSink). Both >= 0; may be called several times per node.
    void AddTerminal(int node, Capacity costSource, Capacity costSink);

    // An edge u -> v of capacity `forward` and v -> u of capacity `backward` (both >= 0): cut
    // when u ends on the source side and v on the sink side (resp. the reverse).
    void AddEdge(int u, int v, Capacity forward, Capacity backward);

    // The value of the minimum cut; afterwards OnSinkSide tells each node's side.
    double Solve();
    bool OnSinkSide(int node) const;

  private:
    static constexpr int kNone = -1, kTerminal = -2, kOrphan = -3;

    struct Arc {
        int head;
        int next;  // the next arc out of the same node
        Capacity residual;
    };
    struct Node {
        int first = -1;           // the first arc out of the node
        int parent = kNone;       // the arc to the parent in its tree, or kNone/kTerminal/kOrphan
        Capacity terminal = 0;    // > 0: residual from the source; < 0: residual to the sink
        std::uint32_t stamp = 0;  // when dist was last known right
        int dist = 0;             // distance to the terminal along the tree
        bool sink = false;        // in the sink's tree (when it has a parent)
        bool active = false;
    };

    static int Sister(int arc) { return arc ^ 1; }
    void Activate(int node);
    int FindPath(int node);  // grows the tree from node; the arc source tree -> sink tree or -1
    void Augment(int middle);
    void Adopt(int node);

    std::vector<Node> nodes_;
    std::vector<Arc> arcs_;
    std::vector<int> active_;  // a queue: activeHead_ is its front
    std::size_t activeHead_ = 0;
    std::vector<int> orphans_;
    std::uint32_t time_ = 0;
    double flow_ = 0;
};

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
