// Gives the library a translation unit of its own while all twins are headers.
namespace support {}
