// Frames cut from a stream of any read sizes, and decoded with their large parts left encoded.
#include <gtest/gtest.h>

#include <algorithm>

#include "platform/linux/lumo/transport/lumo_frame.h"
#include "platform/value/lazy_container.h"

namespace typhora {
namespace {

Value fontsInfo(int count) {
  std::vector<DictionaryEntry> records;
  for (int i = 0; i < count; ++i) {
    records.emplace_back("/fonts/F" + std::to_string(i) + ".otf",
                         Value::dictionary({{"familyName", "F" + std::to_string(i)},
                                            {"installDate", Value(Date{1.7e9 + i})}}));
  }
  return Value::dictionary({{"fontsInfo", Value(Dictionary(std::move(records)))}});
}

Bytes frameOf(const LumoMessage& message) {
  Bytes frame;
  std::vector<int> fds;
  std::string error;
  EXPECT_TRUE(encodeLumoFrame(message, &frame, &fds, nullptr, &error)) << error;
  return frame;
}

std::vector<LumoMessage> messages() {
  return {{LumoMessage::Kind::Invoke, 7, "checkin:", {}},
          {LumoMessage::Kind::Reply, 7, "", {fontsInfo(500)}},
          {LumoMessage::Kind::Reply, 8, "", {Value("small"), Value(3)}},
          {LumoMessage::Kind::Reply, 9, "", {fontsInfo(300), fontsInfo(2)}}};
}

TEST(LumoFrame, FramesCutFromReadsOfAnySizeDecodeToTheirMessages) {
  Bytes stream;
  for (const LumoMessage& message : messages()) {
    const Bytes frame = frameOf(message);
    stream.insert(stream.end(), frame.begin(), frame.end());
  }
  for (std::size_t chunk : {std::size_t{1}, std::size_t{7}, std::size_t{4096}, stream.size()}) {
    SCOPED_TRACE(chunk);
    LumoFrameSplitter splitter;
    std::vector<LumoMessage> decoded;
    for (std::size_t at = 0; at < stream.size(); at += chunk) {
      splitter.addBytes({stream.data() + at, std::min(chunk, stream.size() - at)});
      LumoRawFrame frame;
      std::string error;
      while (splitter.next(&frame, &error) == LumoFrameSplitter::Status::Frame) {
        auto message = decodeLumoFrame(std::move(frame), {}, nullptr, &error);
        ASSERT_TRUE(message) << error;
        decoded.push_back(std::move(*message));
      }
      EXPECT_TRUE(error.empty()) << error;
    }
    EXPECT_EQ(splitter.bufferedBytes(), 0u);
    const std::vector<LumoMessage> sent = messages();
    ASSERT_EQ(decoded.size(), sent.size());
    for (std::size_t i = 0; i < sent.size(); ++i) {
      EXPECT_EQ(decoded[i].kind, sent[i].kind);
      EXPECT_EQ(decoded[i].id, sent[i].id);
      EXPECT_EQ(decoded[i].text, sent[i].text);
      EXPECT_EQ(decoded[i].values, sent[i].values);
    }
    // The large answer stays encoded in its payload until read.
    EXPECT_NE(decoded[1].values[0].get("fontsInfo").lazyContainer(), nullptr);
    EXPECT_EQ(decoded[2].values[0].lazyContainer(), nullptr);
  }
}

// A hostile frame is refused when it is decoded, whatever part of it is at fault: nothing is left
// to fail when a large part is first read.
TEST(LumoFrame, AFaultDeepInALargeFrameIsRefusedWhenDecoded) {
  const Bytes good = frameOf({LumoMessage::Kind::Reply, 7, "", {fontsInfo(500)}});
  const std::string name = "/fonts/F250.otf";
  auto at = std::search(good.begin(), good.end(), name.begin(), name.end());
  ASSERT_NE(at, good.end());
  Bytes bad = good;
  bad[static_cast<std::size_t>(at - good.begin()) + 3] = 0xff;  // not UTF-8
  LumoFrameSplitter splitter;
  splitter.addBytes(bad);
  LumoRawFrame frame;
  std::string error;
  ASSERT_EQ(splitter.next(&frame, &error), LumoFrameSplitter::Status::Frame);
  EXPECT_FALSE(decodeLumoFrame(std::move(frame), {}, nullptr, &error));
  EXPECT_NE(error.find("UTF-8"), std::string::npos) << error;
}

}  // namespace
}  // namespace typhora
