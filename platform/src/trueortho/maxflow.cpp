#include "maxflow.h"

#include <algorithm>
#include <climits>
#include <cmath>

namespace kestrel {
namespace processes {
namespace trueortho {

void MaxFlow::Reset(int nodes, std::size_t edges) {
    nodes_.assign(static_cast<std::size_t>(nodes), Node{});
    arcs_.clear();
    arcs_.reserve(2 * edges);
    active_.clear();
    activeHead_ = 0;
    orphans_.clear();
    time_ = 0;
    flow_ = 0;
}

void MaxFlow::AddTerminal(int node, Capacity costSource, Capacity costSink) {
    Node& n = nodes_[static_cast<std::size_t>(node)];
    // Only the difference needs a residual; the common part is cut whichever side the node
    // takes. Costs added earlier in the other direction cancel the same way.
    flow_ += std::min(costSource, costSink);
    const Capacity d = costSink - costSource;
    if ((n.terminal > 0 && d < 0) || (n.terminal < 0 && d > 0))
        flow_ += std::min(std::fabs(n.terminal), std::fabs(d));
    n.terminal += d;
}

void MaxFlow::AddEdge(int u, int v, Capacity forward, Capacity backward) {
    arcs_.push_back({v, nodes_[static_cast<std::size_t>(u)].first, forward});
    nodes_[static_cast<std::size_t>(u)].first = static_cast<int>(arcs_.size() - 1);
    arcs_.push_back({u, nodes_[static_cast<std::size_t>(v)].first, backward});
    nodes_[static_cast<std::size_t>(v)].first = static_cast<int>(arcs_.size() - 1);
}

bool MaxFlow::OnSinkSide(int node) const {
    const Node& n = nodes_[static_cast<std::size_t>(node)];
    return n.parent != kNone && n.sink;
}

void MaxFlow::Activate(int node) {
    Node& n = nodes_[static_cast<std::size_t>(node)];
    if (!n.active) {
        n.active = true;
        active_.push_back(node);
    }
}

int MaxFlow::FindPath(int i) {
    const Node& n = nodes_[static_cast<std::size_t>(i)];
    for (int a = n.first; a >= 0; a = arcs_[a].next) {
        // The source tree grows along residual arcs out of its nodes, the sink tree along
        // residual arcs into them.
        if ((n.sink ? arcs_[Sister(a)].residual : arcs_[a].residual) <= 0)
            continue;
        const int j = arcs_[a].head;
        Node& m = nodes_[static_cast<std::size_t>(j)];
        if (m.parent == kNone) {
            m.sink = n.sink;
            m.parent = Sister(a);
            m.stamp = n.stamp;
            m.dist = n.dist + 1;
            Activate(j);
        } else if (m.sink != n.sink) {
            return n.sink ? Sister(a) : a;
        } else if (m.stamp <= n.stamp && m.dist > n.dist) {
            // A shorter way to the terminal: keeps the trees shallow.
            m.parent = Sister(a);
            m.stamp = n.stamp;
            m.dist = n.dist + 1;
        }
    }
    return -1;
}

void MaxFlow::Augment(int middle) {
    auto orphan = [&](int node) {
        nodes_[static_cast<std::size_t>(node)].parent = kOrphan;
        orphans_.push_back(node);
    };
    // The bottleneck along source root -> ... -> middle -> ... -> sink root.
    Capacity b = arcs_[middle].residual;
    for (int i = arcs_[Sister(middle)].head;;) {
        const Node& n = nodes_[static_cast<std::size_t>(i)];
        if (n.parent == kTerminal) {
            b = std::min(b, n.terminal);
            break;
        }
        b = std::min(b, arcs_[Sister(n.parent)].residual);
        i = arcs_[n.parent].head;
    }
    for (int i = arcs_[middle].head;;) {
        const Node& n = nodes_[static_cast<std::size_t>(i)];
        if (n.parent == kTerminal) {
            b = std::min(b, -n.terminal);
            break;
        }
        b = std::min(b, arcs_[n.parent].residual);
        i = arcs_[n.parent].head;
    }
    arcs_[middle].residual -= b;
    arcs_[Sister(middle)].residual += b;
    for (int i = arcs_[Sister(middle)].head;;) {
        Node& n = nodes_[static_cast<std::size_t>(i)];
        if (n.parent == kTerminal) {
            n.terminal -= b;
            if (n.terminal == 0)
                orphan(i);
            break;
        }
        const int p = n.parent;
        arcs_[p].residual += b;
        arcs_[Sister(p)].residual -= b;
        if (arcs_[Sister(p)].residual == 0)
            orphan(i);
        i = arcs_[p].head;
    }
    for (int i = arcs_[middle].head;;) {
        Node& n = nodes_[static_cast<std::size_t>(i)];
        if (n.parent == kTerminal) {
            n.terminal += b;
            if (n.terminal == 0)
                orphan(i);
            break;
        }
        const int p = n.parent;
        arcs_[Sister(p)].residual += b;
        arcs_[p].residual -= b;
        if (arcs_[p].residual == 0)
            orphan(i);
        i = arcs_[p].head;
    }
    flow_ += b;
}

void MaxFlow::Adopt(int i) {
    Node& n = nodes_[static_cast<std::size_t>(i)];
    int best = -1, bestDist = INT_MAX;
    for (int a = n.first; a >= 0; a = arcs_[a].next) {
        if ((n.sink ? arcs_[a].residual : arcs_[Sister(a)].residual) <= 0)
            continue;
        const int j = arcs_[a].head;
        if (nodes_[j].parent == kNone || nodes_[j].sink != n.sink)
            continue;
        // Does j still reach the terminal? Distances known in this round cut the walk short.
        int d = 0;
        for (int k = j;;) {
            Node& m = nodes_[static_cast<std::size_t>(k)];
            if (m.stamp == time_) {
                d += m.dist;
                break;
            }
            ++d;
            if (m.parent == kTerminal) {
                m.stamp = time_;
                m.dist = 1;
                break;
            }
            if (m.parent == kOrphan) {
                d = INT_MAX;
                break;
            }
            k = arcs_[m.parent].head;
        }
        if (d == INT_MAX)
            continue;
        if (d < bestDist)
            best = a, bestDist = d;
        for (int k = j; nodes_[k].stamp != time_; k = arcs_[nodes_[k].parent].head) {
            nodes_[k].stamp = time_;
            nodes_[k].dist = d--;
        }
    }
    if (best >= 0) {
        n.parent = best;
        n.stamp = time_;
        n.dist = bestDist + 1;
        return;
    }
    // No way back to the tree: the node is free, its children orphans, and the neighbours that
    // could reach it grow again.
    n.parent = kNone;
    for (int a = n.first; a >= 0; a = arcs_[a].next) {
        const int j = arcs_[a].head;
        Node& m = nodes_[static_cast<std::size_t>(j)];
        if (m.parent == kNone || m.sink != n.sink)
            continue;
        if ((n.sink ? arcs_[a].residual : arcs_[Sister(a)].residual) > 0)
            Activate(j);
        if (m.parent != kTerminal && m.parent != kOrphan && arcs_[m.parent].head == i) {
            m.parent = kOrphan;
            orphans_.push_back(j);
        }
    }
}

double MaxFlow::Solve() {
    // Paths of one arc from a node the source feeds to one that drains to the sink, saturated
    // before the trees grow: most of a grid's flow, without the trees' bookkeeping.
    for (std::size_t i = 0; i < nodes_.size(); ++i) {
        Node& n = nodes_[i];
        for (int a = n.first; a >= 0 && n.terminal > 0; a = arcs_[a].next) {
            Node& m = nodes_[static_cast<std::size_t>(arcs_[a].head)];
            if (m.terminal >= 0 || arcs_[a].residual <= 0)
                continue;
            const Capacity b = std::min({n.terminal, -m.terminal, arcs_[a].residual});
            n.terminal -= b;
            m.terminal += b;
            arcs_[a].residual -= b;
            arcs_[Sister(a)].residual += b;
            flow_ += b;
        }
    }
    for (std::size_t i = 0; i < nodes_.size(); ++i) {
        Node& n = nodes_[i];
        if (n.terminal != 0) {
            n.sink = n.terminal < 0;
            n.parent = kTerminal;
            n.stamp = 0;
            n.dist = 1;
            Activate(static_cast<int>(i));
        }
    }
    int current = -1;
    for (;;) {
        int i = current;
        if (i >= 0) {
            nodes_[static_cast<std::size_t>(i)].active = false;
            if (nodes_[static_cast<std::size_t>(i)].parent == kNone)
                i = -1;
        }
        while (i < 0 && activeHead_ < active_.size()) {
            const int j = active_[activeHead_++];
            nodes_[static_cast<std::size_t>(j)].active = false;
            if (nodes_[static_cast<std::size_t>(j)].parent != kNone)
                i = j;
        }
        if (activeHead_ > 4096 && activeHead_ * 2 > active_.size()) {
            active_.erase(active_.begin(), active_.begin() + static_cast<long>(activeHead_));
            activeHead_ = 0;
        }
        if (i < 0)
            break;
        const int middle = FindPath(i);
        ++time_;
        if (middle < 0) {
            current = -1;
            continue;
        }
        // Keep growing from the same node next time; marked active so it is not queued twice.
        nodes_[static_cast<std::size_t>(i)].active = true;
        current = i;
        Augment(middle);
        for (std::size_t k = 0; k < orphans_.size(); ++k)
            Adopt(orphans_[k]);
        orphans_.clear();
    }
    return flow_;
}

}  // namespace trueortho
}  // namespace processes
}  // namespace kestrel
