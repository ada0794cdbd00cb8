// SPDX-License-Identifier: Apache-2.0
// SPDX-FileCopyrightText: The BrenvikMobileHelper authors
#include "platform/plist/internal/XmlSize.h"

#include <unordered_map>
#include <vector>

#include "platform/plist/internal/Document.h"
#include "platform/plist/internal/XmlWriter.h"

namespace brenvik::plist {

bool xmlFormFits(const Node& root) {
  struct Frame {
    const Node* node;
    std::size_t next;
    XmlExtent extent;
  };
  std::unordered_map<const Node*, XmlExtent> known;  // by children
  std::vector<Frame> frames;
  const Node& top = resolved(root);
  if (!top.isContainer() || top.size == 0) return fitsXmlLimit(xmlExtentOf(top));
  frames.push_back({&top, 0, tagExtent(top.tag)});
  while (true) {
    Frame& frame = frames.back();
    if (frame.next == frame.node->childCount()) {
      const XmlExtent done = frame.extent;
      if (!fitsXmlLimit(done)) return false;
      known.emplace(frame.node->children, done);
      frames.pop_back();
      if (frames.empty()) return true;
      continue;  // the parent looks at this child again, and finds it known
    }
    const bool isKey = frame.node->tag == Tag::dictionary && frame.next % 2 == 0;
    const Node& child = resolved(frame.node->children[frame.next]);
    if (!child.isContainer() || child.size == 0) {
      frame.extent.addChild(isKey ? xmlExtentOfKey(child) : xmlExtentOf(child));
    } else if (const auto found = known.find(child.children); found != known.end()) {
      frame.extent.addChild(found->second);
    } else {
      frames.push_back({&child, 0, tagExtent(child.tag)});
      continue;
    }
    ++frame.next;
  }
}

}  // namespace brenvik::plist
