#include <IC/Node.h>

#include <algorithm>
#include <utility>

namespace IC {

namespace {
Error done()
{
    return Error(0, Number(Number::Generic), std::string());
}
} // namespace

Node::Node(SensorType type, unsigned int instance, unsigned int nodeId, unsigned int linkedId,
           std::string description, unsigned int nodeNumber)
    : type_(type), instance_(instance), nodeId_(nodeId), linkedId_(linkedId),
      nodeNumber_(nodeNumber), description_(std::move(description))
{
}

Node::Node(Node const& other)
    : type_(other.type_), instance_(other.instance_), nodeId_(other.nodeId_),
      linkedId_(other.linkedId_), nodeNumber_(other.nodeNumber_),
      description_(other.description_), path_(other.path_), linkedPath_(other.linkedPath_),
      properties_(other.getProperties())
{
}

Node& Node::operator=(Node const& other)
{
    if (this == &other)
        return *this;
    std::vector<Property> props = other.getProperties();
    type_ = other.type_;
    instance_ = other.instance_;
    nodeId_ = other.nodeId_;
    linkedId_ = other.linkedId_;
    nodeNumber_ = other.nodeNumber_;
    description_ = other.description_;
    path_ = other.path_;
    linkedPath_ = other.linkedPath_;
    std::lock_guard<std::mutex> g(propertiesLock_);
    properties_ = std::move(props);
    return *this;
}

Node::~Node() = default;

unsigned int Node::getNodeNumber() const { return nodeNumber_; }
std::string Node::getDescription() const { return description_; }

std::vector<Node::Property> Node::getProperties() const
{
    std::lock_guard<std::mutex> g(propertiesLock_);
    return properties_;
}

bool Node::getProperty(std::string const& name, Property* out) const
{
    std::lock_guard<std::mutex> g(propertiesLock_);
    auto it = std::find_if(properties_.begin(), properties_.end(),
                           [&name](Property const& p) { return p.name == name; });
    if (it == properties_.end())
        return false;
    if (out)
        *out = *it;
    return true;
}

void Node::setProperty(std::string const& name, std::string const& value, std::string const& unit)
{
    std::lock_guard<std::mutex> g(propertiesLock_);
    auto it = std::find_if(properties_.begin(), properties_.end(),
                           [&name](Property const& p) { return p.name == name; });
    if (it == properties_.end()) {
        properties_.push_back(Property{name, value, unit});
    } else {
        it->value = value;
        it->unit = unit;
    }
}

bool Node::removeProperty(std::string const& name)
{
    std::lock_guard<std::mutex> g(propertiesLock_);
    auto it = std::find_if(properties_.begin(), properties_.end(),
                           [&name](Property const& p) { return p.name == name; });
    if (it == properties_.end())
        return false;
    properties_.erase(it);
    return true;
}

unsigned int Node::getNodeId() const { return nodeId_; }
unsigned int Node::getLinkedId() const { return linkedId_; }
unsigned int Node::getInstance() const { return instance_; }

void Node::setInstance(unsigned int instance) { instance_ = instance; }
void Node::setLinkedId(unsigned int linkedId) { linkedId_ = linkedId; }
void Node::setNodeId(unsigned int nodeId) { nodeId_ = nodeId; }
void Node::setDescription(std::string const& description) { description_ = description; }

Error Node::setPath(std::string const& path)
{
    path_ = path;
    return done();
}

Error Node::setLinkedPath(std::string const& path)
{
    linkedPath_ = path;
    return done();
}

} // namespace IC
