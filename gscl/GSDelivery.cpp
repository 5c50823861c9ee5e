#include "gscl/GSControllerData_internal.h"
#include "gscl/GSDelivery_internal.h"
#include "gscl/GSProvider.h"
#include "gscl/GSSubscriber.h"
#include "gscl/scopes_internal.h"

namespace zelt_gscl_V1 {

namespace {

// Statically initialised and never destroyed: clients may outlive the library's static objects. The mutex guards
// the list and the clients in it; it comes after the controller's lock and no other lock is taken under it.
pthread_mutex_t pins_mutex = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t pin_released = PTHREAD_COND_INITIALIZER;  // broadcast when a delivery ends while a client retires
GSDelivery* pins = nullptr;                              // deliveries under way, the latest first
int retiring = 0;                                        // threads that wait in retire

class PinsScope {
 public:
  PinsScope() { pthread_mutex_lock(&pins_mutex); }
  ~PinsScope() { pthread_mutex_unlock(&pins_mutex); }
  PinsScope(const PinsScope&) = delete;
  PinsScope& operator=(const PinsScope&) = delete;
};

}  // namespace

GSDelivery::GSDelivery(wyx_token_t token) {
  GSController* controller = GSController::theController();
  if (controller == nullptr) return;
  controller_found_ = true;
  gscl_internal::ReadScope<GSController> registry(*controller);
  client_ = controller->_ctrlData->find(token);
  if (client_ != nullptr) pin();
}

GSDelivery::~GSDelivery() {
  if (pinned_) unpin();
}

GSProvider* GSDelivery::provider() const {
  if (client_ == nullptr || client_->type() != zelt_gscl::GS_PROVIDER) return nullptr;
  return static_cast<GSProvider*>(client_);
}

GSSubscriber* GSDelivery::subscriber() const {
  if (client_ == nullptr || client_->type() != zelt_gscl::GS_SUBSCRIBER) return nullptr;
  return static_cast<GSSubscriber*>(client_);
}

void GSDelivery::pin() {
  PinsScope scope;
  pinned_ = true;
  next_ = pins;
  if (pins != nullptr) pins->previous_ = this;
  pins = this;
}

void GSDelivery::unpin() {
  PinsScope scope;
  (previous_ != nullptr ? previous_->next_ : pins) = next_;
  if (next_ != nullptr) next_->previous_ = previous_;
  if (retiring > 0) pthread_cond_broadcast(&pin_released);
}

bool GSDelivery::settlePins(const GSClient* client) {
  const pthread_t self = pthread_self();
  bool elsewhere = false;
  for (GSDelivery* pin = pins; pin != nullptr; pin = pin->next_) {
    if (pin->client_ != client) continue;
    if (pthread_equal(pin->thread_, self)) {
      pin->client_ = nullptr;
    } else {
      elsewhere = true;
    }
  }
  return !elsewhere;
}

void GSDelivery::retire(GSClient* client) {
  GSxControllerData::forEach([client](GSController& controller) { controller.removeClient(client); });
  PinsScope scope;
  ++retiring;
  while (!settlePins(client)) pthread_cond_wait(&pin_released, &pins_mutex);
  --retiring;
}

}  // namespace zelt_gscl_V1
