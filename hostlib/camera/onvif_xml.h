// Namespace-aware reading of SOAP replies with pugixml, shared by the reply
// readers of onvif_soap.cpp and onvif_event_soap.cpp. Internal to the camera
// drivers.
#ifndef HOSTLIB_ONVIF_XML_H
#define HOSTLIB_ONVIF_XML_H

#include <string.h>

#include <map>
#include <pugixml.hpp>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "hostlib/camera/onvif_soap.h"

namespace onvif {

namespace xml {

inline std::string Escape(const std::string& s) {
    std::string out;
    for (char c : s) {
        switch (c) {
            case '&':
                out += "&amp;";
                break;
            case '<':
                out += "&lt;";
                break;
            case '>':
                out += "&gt;";
                break;
            case '"':
                out += "&quot;";
                break;
            case '\'':
                out += "&apos;";
                break;
            default:
                out += c;
        }
    }
    return out;
}

inline const char* LocalName(const char* name) {
    const char* colon = strchr(name, ':');
    return colon ? colon + 1 : name;
}

// The namespace URI bound to `prefix` ("" = the default namespace) at `node`:
// the nearest xmlns declaration on the node or an ancestor. Found: true.
inline bool ResolvePrefix(pugi::xml_node node, const std::string& prefix, std::string* uri) {
    std::string attr = prefix.empty() ? std::string("xmlns") : "xmlns:" + prefix;
    for (pugi::xml_node n = node; n; n = n.parent()) {
        if (n.type() != pugi::node_element) continue;
        pugi::xml_attribute a = n.attribute(attr.c_str());
        if (a) {
            *uri = a.value();
            return true;
        }
    }
    return false;
}

// The namespace URI of an element: its prefix resolved through the xmlns
// declarations of the element and its ancestors.
inline std::string NamespaceOf(pugi::xml_node node) {
    const char* name = node.name();
    const char* colon = strchr(name, ':');
    std::string uri;
    ResolvePrefix(node, colon ? std::string(name, colon - name) : std::string(), &uri);
    return uri;
}

inline bool Matches(pugi::xml_node node, const char* ns, const char* local) {
    return node.type() == pugi::node_element && strcmp(LocalName(node.name()), local) == 0 &&
           NamespaceOf(node) == ns;
}

inline pugi::xml_node Child(pugi::xml_node node, const char* ns, const char* local) {
    for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
        if (Matches(c, ns, local)) return c;
    return {};
}

inline std::vector<pugi::xml_node> Children(pugi::xml_node node, const char* ns,
                                            const char* local) {
    std::vector<pugi::xml_node> out;
    for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
        if (Matches(c, ns, local)) out.push_back(c);
    return out;
}

// The namespace declarations of a document, gathered in one walk, so that
// resolving an element's prefix costs one lookup per ancestor instead of a
// scan of each ancestor's attributes: a reply with thousands of attributes
// and thousands of matching elements would otherwise take minutes to read.
// Names and values point into the document, which must outlive the index.
class Namespaces {
public:
    void Index(const pugi::xml_document& doc) {
        declared_.clear();
        for (pugi::xml_node n = doc.first_child(); n;) {
            if (n.type() == pugi::node_element)
                for (pugi::xml_attribute a = n.first_attribute(); a; a = a.next_attribute()) {
                    const char* name = a.name();
                    if (strncmp(name, "xmlns", 5) != 0 || (name[5] != '\0' && name[5] != ':'))
                        continue;
                    // The first declaration of a prefix on an element counts.
                    declared_.emplace(Key{n.internal_object(), name[5] ? name + 6 : ""}, a.value());
                }
            // Depth first, without recursion.
            if (n.first_child()) {
                n = n.first_child();
                continue;
            }
            while (n && !n.next_sibling()) n = n.parent();
            if (n) n = n.next_sibling();
        }
    }

    // The namespace URI of an element: its prefix resolved through the
    // declarations of the element and its ancestors; "" when undeclared.
    const char* Of(pugi::xml_node node) const {
        const char* name = node.name();
        const char* colon = strchr(name, ':');
        std::string_view prefix = colon ? std::string_view(name, colon - name) : std::string_view();
        for (pugi::xml_node n = node; n; n = n.parent()) {
            if (n.type() != pugi::node_element) continue;
            auto it = declared_.find(Key{n.internal_object(), prefix});
            if (it != declared_.end()) return it->second;
        }
        return "";
    }

    bool Matches(pugi::xml_node node, const char* ns, const char* local) const {
        return node.type() == pugi::node_element && strcmp(LocalName(node.name()), local) == 0 &&
               strcmp(Of(node), ns) == 0;
    }

    pugi::xml_node Child(pugi::xml_node node, const char* ns, const char* local) const {
        for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
            if (Matches(c, ns, local)) return c;
        return {};
    }

    std::vector<pugi::xml_node> Children(pugi::xml_node node, const char* ns,
                                         const char* local) const {
        std::vector<pugi::xml_node> out;
        for (pugi::xml_node c = node.first_child(); c; c = c.next_sibling())
            if (Matches(c, ns, local)) out.push_back(c);
        return out;
    }

private:
    using Key = std::pair<const void*, std::string_view>;  // element, prefix ("" default)
    std::map<Key, const char*> declared_;
};

inline std::string Trimmed(const char* text) {
    std::string s = text;
    size_t b = s.find_first_not_of(" \t\r\n");
    if (b == std::string::npos) return "";
    size_t e = s.find_last_not_of(" \t\r\n");
    return s.substr(b, e - b + 1);
}

inline std::string Text(pugi::xml_node node) { return Trimmed(node.text().as_string()); }

}  // namespace xml

struct Reply::Impl {
    pugi::xml_document doc;
    xml::Namespaces names;  // indexed once per parsed reply
    pugi::xml_node body;    // first element of the Body
};

}  // namespace onvif

#endif  // HOSTLIB_ONVIF_XML_H
