// Internals of the pairing store that its tests reach: the key of its semaphore and where its
// messages go.
#ifndef S2S_HOST_PAIRING_STORE_H
#define S2S_HOST_PAIRING_STORE_H

namespace S2S {
namespace PairingStore {

// The semaphore every writer of the store takes: one per system, shared with every other
// program that writes the file.
constexpr int kSemaphoreKey = 0x2980298;

// Receives each message, already formatted, instead of syslog. Called from any thread; must not
// call back into the store.
using MessageSink = void (*)(const char* message);

// Sends the store's messages to `sink`, or back to syslog (LOG_ERR) when null. Returns the sink
// that was in place.
MessageSink SetMessageSink(MessageSink sink);

}  // namespace PairingStore
}  // namespace S2S

#endif  // S2S_HOST_PAIRING_STORE_H
