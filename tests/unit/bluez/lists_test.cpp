// AdapterList and DeviceList own their elements.
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include <bluetooth/btbus.h>

namespace {

using namespace Bluetooth;

// Records its path when deleted, to see which elements a list deletes and when.
template <typename Base>
class Tracked : public Base {
public:
    Tracked(const char* path, std::vector<std::string>* deleted) : Base(path), deleted_(deleted) {}
    ~Tracked() override { deleted_->push_back(this->getPath()); }

private:
    std::vector<std::string>* deleted_;
};

template <typename List, typename Element>
void expectOwnsElementsFrontToBackSkippingNull() {
    std::vector<std::string> deleted;
    List* list = new List;
    list->push_back(new Tracked<Element>("/a", &deleted));
    list->push_back(nullptr);
    list->push_back(new Tracked<Element>("/b", &deleted));
    EXPECT_EQ(list->size(), 3u);
    EXPECT_TRUE(deleted.empty());
    delete list;
    EXPECT_EQ(deleted, (std::vector<std::string>{ "/a", "/b" }));
}

TEST(AnAdapterList, DeletesItsAdaptersFrontToBackAndSkipsNullElements) {
    expectOwnsElementsFrontToBackSkippingNull<AdapterList, Adapter>();
}

TEST(ADeviceList, DeletesItsDevicesFrontToBackAndSkipsNullElements) {
    expectOwnsElementsFrontToBackSkippingNull<DeviceList, Device>();
}

}  // namespace
