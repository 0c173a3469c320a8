#include "qvm/python/NumpyBridge.hpp"

#include <pybind11/numpy.h>

#include <algorithm>
#include <complex>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "foundation/korveldata/ArrayFactory.hpp"
#include "qvm/python/PythonText.hpp"

namespace py = pybind11;

namespace qvm {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::elementSize;
using foundation::korveldata::ElementType;
using foundation::korveldata::elementTypeName;
using foundation::korveldata::MemoryOrder;
using Npy = py::detail::npy_api;

struct NumpyType {
    ElementType element;
    char kind;  // of the dtype
    int number;
};

constexpr NumpyType elementTypes[] = {
    {ElementType::Bool, 'b', Npy::NPY_BOOL_},
    {ElementType::Single, 'f', Npy::NPY_FLOAT_},
    {ElementType::Double, 'f', Npy::NPY_DOUBLE_},
    {ElementType::Int8, 'i', Npy::NPY_INT8_},
    {ElementType::UInt8, 'u', Npy::NPY_UINT8_},
    {ElementType::Int16, 'i', Npy::NPY_INT16_},
    {ElementType::UInt16, 'u', Npy::NPY_UINT16_},
    {ElementType::Int32, 'i', Npy::NPY_INT32_},
    {ElementType::UInt32, 'u', Npy::NPY_UINT32_},
    {ElementType::Int64, 'i', Npy::NPY_INT64_},
    {ElementType::UInt64, 'u', Npy::NPY_UINT64_},
    {ElementType::ComplexSingle, 'c', Npy::NPY_CFLOAT_},
    {ElementType::ComplexDouble, 'c', Npy::NPY_CDOUBLE_},
};

std::string program() {
    return "this Python (" + std::string(py::str(py::module_::import("sys").attr("executable"))) + ")";
}

py::dtype dtypeOf(ElementType element) {
    const auto* const row = std::find_if(std::begin(elementTypes), std::end(elementTypes),
                                         [&](const NumpyType& each) { return each.element == element; });
    if (row == std::end(elementTypes)) {
        throw NotConvertible("has elements of type " + std::string(elementTypeName(element)) +
                             ", which NumPy does not have");
    }
    return py::dtype(row->number);
}

// The module, which everything below needs that is neither text nor a number. The headers of NumPy 1 look into its
// objects, which another major version lays out differently.
py::module_ numpyModule() {
    static PyObject* const name = PyUnicode_InternFromString("numpy");
    static bool fits = false;
    // An import takes longer than a look at the modules that are there, even of one of them.
    auto numpy = py::reinterpret_steal<py::module_>(fits ? PyImport_GetModule(name) : nullptr);
    if (numpy && !numpy.is_none()) {
        return numpy;
    }
    try {
        numpy = py::module_::import("numpy");
    } catch (py::error_already_set& error) {
        if (!error.matches(PyExc_ImportError)) {
            throw;
        }
        const std::string why = py::str(error.value());
        py::raise_from(error, PyExc_ImportError,
                       ("Arrays need NumPy, which " + program() + " cannot import: " + why).c_str());
        throw py::error_already_set();
    }
    if (!fits) {
        const std::string version = py::str(numpy.attr("__version__"));
        fits = version.starts_with("1.");
        if (!fits) {
            PyErr_SetString(PyExc_ImportError, ("Arrays need NumPy 1; " + program() + " has " + version).c_str());
            throw py::error_already_set();
        }
    }
    return numpy;
}

// By kind and size: C has several integer types of one size, and NumPy tells them apart.
std::optional<ElementType> elementTypeOf(const py::dtype& dtype) {
    const auto* const row = std::find_if(std::begin(elementTypes), std::end(elementTypes), [&](const NumpyType& each) {
        return each.kind == dtype.kind() && elementSize(each.element) == static_cast<std::size_t>(dtype.itemsize());
    });
    return row == std::end(elementTypes) ? std::nullopt : std::optional(row->element);
}

py::object textOf(const Array& array) {
    const auto dimensions = array.dimensions();
    const auto extended = std::count_if(dimensions.begin(), dimensions.end(), [](std::uint64_t n) { return n > 1; });
    if (extended > 1) {
        throw NotConvertible("is text in several rows; only a single row of UTF-16 code units can be passed, as a str");
    }
    int littleEndian = -1;
    PyObject* const text =
        PyUnicode_DecodeUTF16(array.data(), static_cast<Py_ssize_t>(array.sizeInBytes()), "replace", &littleEndian);
    if (text == nullptr) {
        throw py::error_already_set();
    }
    return py::reinterpret_steal<py::object>(text);
}

std::vector<py::ssize_t> shapeOf(const Array& array) {
    std::vector<py::ssize_t> shape;
    for (const std::uint64_t dimension : array.dimensions()) {
        shape.push_back(static_cast<py::ssize_t>(dimension));
    }
    return shape;
}

std::vector<py::ssize_t> stridesOf(const Array& array) {
    const auto dimensions = array.dimensions();
    std::vector<py::ssize_t> strides(dimensions.size());
    // Unsigned, because the dimensions of an array without elements may be of any size. NumPy refuses those that it
    // cannot have.
    std::uint64_t stride = elementSize(array.elementType());
    for (std::size_t i = 0; i < strides.size(); ++i) {
        const std::size_t at = array.order() == MemoryOrder::RowMajor ? strides.size() - 1 - i : i;
        strides[at] = static_cast<py::ssize_t>(stride);
        stride *= std::max<std::uint64_t>(dimensions[at], 1);
    }
    return strides;
}

// Numbers that need no NumPy.
std::optional<Array> scalarOf(PyObject* value) {
    const ArrayFactory factory;
    if (PyBool_Check(value)) {
        return factory.createScalar(value == Py_True);
    }
    if (PyFloat_CheckExact(value)) {
        return factory.createScalar(PyFloat_AS_DOUBLE(value));
    }
    if (PyComplex_CheckExact(value)) {
        return factory.createScalar(std::complex<double>(PyComplex_RealAsDouble(value), PyComplex_ImagAsDouble(value)));
    }
    if (PyLong_CheckExact(value)) {
        int overflow = 0;
        const long long number = PyLong_AsLongLongAndOverflow(value, &overflow);
        if (overflow == 0) {
            return factory.createScalar(static_cast<std::int64_t>(number));
        }
        const unsigned long long large = overflow > 0 ? PyLong_AsUnsignedLongLong(value) : 0;
        if (overflow < 0 || PyErr_Occurred() != nullptr) {
            PyErr_Clear();
            throw NotConvertible("is an int that does not fit into 64 bits");
        }
        return factory.createScalar(static_cast<std::uint64_t>(large));
    }
    return std::nullopt;
}

Array arrayOfText(PyObject* text) {
    return ArrayFactory().createText(utf16Of(text));
}

[[noreturn]] void refuse(const py::array& array) {
    const py::dtype dtype = array.dtype();
    const std::string name = py::str(static_cast<py::handle>(dtype));
    std::string advice;
    if (dtype.kind() == 'f' || dtype.kind() == 'c') {
        advice = std::string("; convert it first, for example with astype('") +
                 (dtype.kind() == 'c'    ? "complex128"
                  : dtype.itemsize() < 4 ? "float32"
                                         : "float64") +
                 "')";
    }
    throw NotConvertible(
        "has dtype " + name +
        ", which cannot be sent; what can is bool, 8- to 64-bit integers, float32, float64, complex64, "
        "complex128, and text as a single str" +
        advice);
}

bool hasOddBools(const py::array& array) {
    const auto* const bytes = static_cast<const unsigned char*>(array.data());
    return std::any_of(bytes, bytes + array.nbytes(), [](unsigned char byte) { return byte > 1; });
}

}  // namespace

py::object toPython(Array array) {
    if (array.elementType() == ElementType::Char16) {
        return textOf(array);
    }
    numpyModule();
    const py::dtype dtype = dtypeOf(array.elementType());
    const bool writable = array.writableInPlace();
    auto kept = std::make_unique<Array>(std::move(array));
    const py::capsule owner(kept.get(), [](void* last) { delete static_cast<Array*>(last); });
    const Array& elements = *kept.release();
    py::array view(dtype, shapeOf(elements), stridesOf(elements), elements.data(), owner);
    if (!writable) {
        py::detail::array_proxy(view.ptr())->flags &= ~Npy::NPY_ARRAY_WRITEABLE_;
    }
    return view;
}

py::object toNumber(const Array& array) {
    if (array.dimensions().empty() && array.elementType() == ElementType::Int64) {
        std::int64_t number = 0;
        std::memcpy(&number, array.data(), sizeof(number));
        return py::int_(number);
    }
    if (array.dimensions().empty() && array.elementType() == ElementType::Double) {
        double number = 0;
        std::memcpy(&number, array.data(), sizeof(number));
        return py::float_(number);
    }
    return {};
}

Array toArray(py::handle value, ReleaseQueue& releases) {
    if (value.is_none()) {
        throw NotConvertible("is None, which is no array");
    }
    if (PyUnicode_Check(value.ptr())) {
        return arrayOfText(value.ptr());
    }
    if (std::optional<Array> scalar = scalarOf(value.ptr())) {
        return *std::move(scalar);
    }
    const py::module_ numpy = numpyModule();
    if (py::isinstance(value, numpy.attr("ma").attr("MaskedArray"))) {
        throw NotConvertible(
            "is a masked array, whose mask would be lost; return its filled(...) or its data and mask");
    }
    py::array array = py::isinstance<py::array>(value)
                          ? py::reinterpret_borrow<py::array>(value)
                          : py::array(py::reinterpret_borrow<py::object>(numpy.attr("asarray")(value)));
    if (array.dtype().kind() == 'U' && array.ndim() == 0) {
        const py::object text = array.attr("item")();
        return arrayOfText(text.ptr());
    }
    const std::optional<ElementType> element = elementTypeOf(array.dtype());
    if (!element) {
        refuse(array);
    }
    const bool otherByteOrder = array.dtype().byteorder() == '>';
    const bool aligned = (array.flags() & Npy::NPY_ARRAY_ALIGNED_) != 0;
    const bool contiguous = (array.flags() & (py::array::c_style | py::array::f_style)) != 0;
    if (otherByteOrder || !aligned || !contiguous) {
        array = numpy.attr("array")(array, py::arg("dtype") = array.dtype().attr("newbyteorder")("="),
                                    py::arg("order") = "A");
    }
    if (*element == ElementType::Bool && hasOddBools(array)) {
        // A view of other bytes; a receiver would have to refuse it.
        array = array.attr("view")("uint8").attr("astype")("bool");
    }
    std::vector<std::uint64_t> dimensions;
    for (py::ssize_t i = 0; i < array.ndim(); ++i) {
        dimensions.push_back(static_cast<std::uint64_t>(array.shape(i)));
    }
    const MemoryOrder order =
        (array.flags() & py::array::c_style) != 0 ? MemoryOrder::RowMajor : MemoryOrder::ColumnMajor;
    return Array::overMemory(*element, dimensions, order, array.data(), releases.hold(array.ptr()));
}

}  // namespace qvm
