// Namespace-aware reading of SOAP replies with pugixml, shared by the reply
// readers of onvif_soap.cpp and onvif_event_soap.cpp. Internal to the camera
// drivers.
#ifndef HOSTLIB_ONVIF_XML_H
#define HOSTLIB_ONVIF_XML_H

#include <string.h>

#include <pugixml.hpp>
#include <string>
#include <vector>

#include "hostlib/camera/onvif_soap.h"

namespace onvif {

struct Reply::Impl {
    pugi::xml_document doc;
    pugi::xml_node body;  // first element of the Body
};

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

inline std::string Trimmed(const char* text) {
    std::string s = text;
    size_t b = s.find_first_not_of(" \t\r\n");
    if (b == std::string::npos) return "";
    size_t e = s.find_last_not_of(" \t\r\n");
    return s.substr(b, e - b + 1);
}

inline std::string Text(pugi::xml_node node) { return Trimmed(node.text().as_string()); }

}  // namespace xml
}  // namespace onvif

#endif  // HOSTLIB_ONVIF_XML_H
