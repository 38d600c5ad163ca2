// A post-office client for Python: send a message by name and wait for the
// answer with the event loop turning, and measure through LumaServer.
#include <atomic>
#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "common.h"
#include "nxbase/lumaclient.h"
#include "nxbase/msgcat.h"
#include "nxbase/postoffice.h"
#include "nxbase/spectralgrid.h"

namespace nxpy {
namespace {

using Clock = std::chrono::steady_clock;

int MessageNumber(const py::object& message) {
    if (py::isinstance<py::int_>(message)) {
        const int number = message.cast<int>();
        if (nxbase::MessageName(number)[0] == '\0') {
            throw py::value_error("no message number " + std::to_string(number));
        }
        return number;
    }
    const std::string name = py::str(message).cast<std::string>();
    const int number = nxbase::NumberOfCommandText(name);
    if (number < 0 || number >= ANZAHL_BOTSCHAFTEN)
        throw py::value_error("unknown message \"" + name + "\"");
    return number;
}

long Checked(const py::object& value, long low, long high, const std::string& type) {
    const long number = value.cast<long>();
    if (number < low || number > high) {
        throw py::value_error(std::to_string(number) + " does not fit type \"" + type + "\"");
    }
    return number;
}

// Writes one value into the data block as the memory-block format does:
// int as a 32-bit int, str as a string with its closing zero, bytes as they
// are, or a (type, value) pair with type "b" (byte), "s" (16-bit), "i"
// (32-bit), "str" or "bytes".
void Pack(MyMemoryBlock& block, const py::handle& item) {
    if (py::isinstance<py::tuple>(item) && py::len(item) == 2) {
        const py::tuple pair = py::reinterpret_borrow<py::tuple>(item);
        const std::string type = py::str(pair[0]).cast<std::string>();
        const py::object value = pair[1];
        if (type == "b") {
            block << static_cast<unsigned char>(Checked(value, -128, 255, type));
        } else if (type == "s") {
            block << static_cast<short>(Checked(value, -32768, 65535, type));
        } else if (type == "i") {
            block << static_cast<int>(Checked(value, -2147483648L, 4294967295L, type));
        } else if (type == "str" || type == "bytes") {
            Pack(block, value);
        } else {
            throw py::value_error("unknown value type \"" + type + "\"; use b, s, i, str or bytes");
        }
    } else if (py::isinstance<py::bool_>(item)) {
        block << static_cast<unsigned char>(item.cast<bool>() ? 1 : 0);
    } else if (py::isinstance<py::int_>(item)) {
        block << static_cast<int>(
            Checked(py::reinterpret_borrow<py::object>(item), -2147483648L, 4294967295L, "i"));
    } else if (py::isinstance<py::str>(item)) {
        block << String(item.cast<std::string>());
    } else if (py::isinstance<py::bytes>(item) || py::isinstance<py::bytearray>(item)) {
        const std::string bytes =
            py::bytes(py::reinterpret_borrow<py::object>(item)).cast<std::string>();
        block.Put(bytes.data(), static_cast<long>(bytes.size()));
    } else {
        throw py::type_error("cannot pack " + py::repr(item).cast<std::string>() +
                             "; use int, str, bytes or a (type, value) pair");
    }
}

class Client;

// Asked while an answer is awaited: lets Python handle Ctrl-C, ends the wait
// at the deadline, and at once when another thread closes the client.
class Waiter {
  public:
    Waiter(double timeout, const std::atomic<bool>& closing)
        : amDeadline(Clock::now() + std::chrono::duration_cast<Clock::duration>(
                                        std::chrono::duration<double>(timeout))),
          amClosing(closing) {}

    bool KeepWaiting() {
        // Once interrupted the error is pending: no more Python calls.
        if (amInterrupted || amClosing.load()) return false;
        {
            py::gil_scoped_acquire locked;
            if (PyErr_CheckSignals() != 0) {
                amInterrupted = true;
                return false;
            }
        }
        return Clock::now() < amDeadline;
    }
    void RaiseIfInterrupted() const {
        if (amInterrupted) throw py::error_already_set();
    }

  private:
    Clock::time_point amDeadline;
    const std::atomic<bool>& amClosing;
    bool amInterrupted = false;
};

// The process's one post office belongs to one open client.
Client* gOpenClient = nullptr;

class Client {
  public:
    explicit Client(const std::string& name) {
        if (gOpenClient != nullptr) {
            throw std::runtime_error(
                "a Client is open already in this process (one post office per process): close "
                "it, or use it");
        }
        try {
            pOffice = PostOffice::CreatePostOffice(String(name));
        } catch (const std::exception& error) {
            throw std::runtime_error("no post office for \"" + name + "\": " + error.what());
        }
        gOpenClient = this;
    }
    ~Client() { Close(); }

    py::tuple Send(const std::string& target, const py::object& message, const py::iterable& values,
                   double timeout) {
        Busy busy(amBusy);
        Office();
        const int number = MessageNumber(message);
        MyMemoryBlock request, answer;
        for (const py::handle item : values) Pack(request, item);
        Waiter waiter(timeout, amClosing);
        unsigned char sent = 0;
        {
            py::gil_scoped_release unlocked;
            sent = pOffice->SendAndReceive(target, number, request, answer,
                                           [&waiter] { return waiter.KeepWaiting(); });
        }
        waiter.RaiseIfInterrupted();
        if (amClosing.load()) throw std::runtime_error("the client was closed while it waited");
        if (!sent) {
            throw std::runtime_error("no answer from " + target + " to " +
                                     nxbase::MessageName(number) + ": " + pOffice->GetLastError());
        }
        const char* data = answer.GetDatenZeiger();
        const long length = answer.Len();
        const int status = length > 0 ? static_cast<signed char>(data[0]) : -1;
        return py::make_tuple(status,
                              py::bytes(length > 1 ? data + 1 : "", length > 1 ? length - 1 : 0));
    }

    void Post(const std::string& target, const py::object& message, const py::iterable& values) {
        Busy busy(amBusy);
        Office();
        const int number = MessageNumber(message);
        MyMemoryBlock request;
        for (const py::handle item : values) Pack(request, item);
        unsigned char sent = 0;
        {
            py::gil_scoped_release unlocked;
            sent = pOffice->Send(target, static_cast<PO_Botschaften>(number), request);
        }
        if (!sent)
            throw std::runtime_error("cannot send " + std::string(nxbase::MessageName(number)) +
                                     " to " + target);
    }

    py::tuple Measure(int count, double timeout) {
        Busy busy(amBusy);
        Office();
        if (count < 1) throw py::value_error("count must be at least 1");
        std::vector<nxbase::MeasuredSpectrum> measured;
        std::string error;
        Waiter waiter(timeout, amClosing);
        bool ok = false;
        {
            py::gil_scoped_release unlocked;
            ok = nxbase::MeasureWithLumaServer(*pOffice, count, &measured, &error, nullptr,
                                               [&waiter] { return waiter.KeepWaiting(); });
        }
        waiter.RaiseIfInterrupted();
        if (!ok) throw std::runtime_error(error);
        py::list ids;
        py::array_t<float> spectra(std::vector<py::ssize_t>{
            static_cast<py::ssize_t>(measured.size()), nxbase::kSpectrumSize});
        float* out = spectra.mutable_data();
        for (const nxbase::MeasuredSpectrum& spectrum : measured) {
            ids.append(spectrum.id);
            std::copy(spectrum.values.begin(), spectrum.values.end(), out);
            out += nxbase::kSpectrumSize;
        }
        return py::make_tuple(ids, spectra);
    }

    // From any thread: a send that waits on another thread ends first (its
    // wait sees the close within 50 ms and raises), then the post office goes.
    void Close() {
        if (pOffice == nullptr || amClosing.exchange(true)) return;
        {
            py::gil_scoped_release unlocked;
            while (amBusy.load() > 0) std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        pOffice = nullptr;
        if (gOpenClient == this) gOpenClient = nullptr;
        NxSingleton::DeleteAllSingleton();
    }

  private:
    // A call in progress, which Close waits for.
    struct Busy {
        explicit Busy(std::atomic<int>& count) : amCount(count) { ++amCount; }
        ~Busy() { --amCount; }
        std::atomic<int>& amCount;
    };

    void Office() const {
        if (pOffice == nullptr || amClosing.load())
            throw std::runtime_error("the client is closed");
    }

    PostOffice* pOffice = nullptr;
    std::atomic<bool> amClosing{false};
    std::atomic<int> amBusy{0};
};

}  // namespace

void RegisterMessaging(py::module_& m) {
    py::class_<Client>(
        m, "Client",
        "A post office under an application name. Peers registered in the machine registry are "
        "started when a message goes to them. One client per process: a second one raises "
        "RuntimeError while the first is open. close() may come from another thread; a send "
        "waiting meanwhile raises RuntimeError.")
        .def(py::init<const std::string&>(), py::arg("name") = "python")
        .def("send", &Client::Send, py::arg("target"), py::arg("message"),
             py::arg("values") = py::tuple(), py::arg("timeout") = 30.0,
             "Sends `message` (a name such as \"GET_DEVICE_NAME\", or its number) with `values` "
             "packed into the "
             "data block (int: 32-bit, str: string with its zero byte, bytes: as they are, or "
             "(type, value) with "
             "type b, s, i, str or bytes), waits with the event loop turning and returns (status, "
             "answer bytes "
             "after the status). RuntimeError without an answer within `timeout` seconds; Ctrl-C "
             "interrupts.")
        .def("post", &Client::Post, py::arg("target"), py::arg("message"),
             py::arg("values") = py::tuple(), "Sends without waiting for an answer.")
        .def("measure", &Client::Measure, py::arg("count"), py::arg("timeout") = 30.0,
             "Measures `count` patches through LumaServer (connect, lock, measure, unlock, "
             "disconnect) and "
             "returns (ids, spectra) with spectra float32 of shape (count, 36).")
        .def("close", &Client::Close, "Closes the post office.")
        .def(
            "__enter__", [](Client& c) -> Client& { return c; }, py::return_value_policy::reference)
        .def("__exit__", [](Client& c, const py::args&) { c.Close(); });
    m.def(
        "unpack",
        [](const py::bytes& data, const std::string& types) {
            const std::string bytes = data;
            MyMemoryBlock block;
            block.Put(bytes.data(), static_cast<long>(bytes.size()));
            py::list values;
            std::size_t start = 0;
            while (start <= types.size()) {
                const std::size_t comma = types.find(',', start);
                const std::string type = types.substr(
                    start, comma == std::string::npos ? std::string::npos : comma - start);
                if (type == "b") {
                    unsigned char v = 0;
                    block >> v;
                    values.append(v);
                } else if (type == "s") {
                    short v = 0;
                    block >> v;
                    values.append(v);
                } else if (type == "i") {
                    int v = 0;
                    block >> v;
                    values.append(v);
                } else if (type == "str") {
                    String v;
                    block >> v;
                    values.append(py::bytes(v.str()).attr("decode")("cp1252", "replace"));
                } else {
                    throw py::value_error("unknown type \"" + type + "\"; use b, s, i or str");
                }
                if (block.ReadPastEnd())
                    throw py::value_error("the data ends before the value of type \"" + type +
                                          "\"");
                if (comma == std::string::npos) break;
                start = comma + 1;
            }
            return values;
        },
        py::arg("data"), py::arg("types"),
        "Reads values from answer bytes: `types` is a comma-separated list of b, s, i and str.");
}

}  // namespace nxpy
