! Interfaces of the sort library's Fortran-callable entries, as a Fortran
! caller sees them: every INTEGER is 32 bits and passed by reference, values
! are 8-byte reals (or 8-byte integers where bit patterns are compared), the
! callbacks are BIND(C) functions passed by address.
module isort_api
  use, intrinsic :: iso_c_binding
  implicit none

  abstract interface
    integer(c_int32_t) function record_in(context, buffer, nvars) bind(c)
      import :: c_int32_t, c_double
      integer(c_int32_t), intent(inout) :: context
      integer(c_int32_t), intent(in) :: nvars
      real(c_double), intent(out) :: buffer(nvars)
    end function
    integer(c_int32_t) function record_out(context, record, nvars) bind(c)
      import :: c_int32_t, c_double
      integer(c_int32_t), intent(inout) :: context
      integer(c_int32_t), intent(in) :: nvars
      real(c_double), intent(in) :: record(nvars)
    end function
  end interface

  interface
    integer(c_int32_t) function sortfile(context, input, output, nvars, ukeys, nukeys, &
                                         a7, a8, a9, a10, a11) bind(c, name='SORTFILE')
      import :: c_int32_t, c_funptr, c_ptr
      integer(c_int32_t), intent(inout) :: context
      type(c_funptr), value :: input, output
      integer(c_int32_t), intent(in) :: nvars, nukeys
      integer(c_int32_t), intent(in) :: ukeys(*)
      type(c_ptr), value :: a7, a8, a9
      integer(c_int32_t), intent(out) :: a10, a11
    end function

    integer(c_int32_t) function srtfva(n, ukeys, keys, map, nmap, nkeypairs, keylength, &
                                       widraw, pack, fill) bind(c, name='SRTFVA')
      import :: c_int32_t
      integer(c_int32_t), intent(in) :: n, ukeys(*), widraw, pack, fill
      integer(c_int32_t), intent(inout) :: keys(*), map(*)
      integer(c_int32_t), intent(out) :: nmap, nkeypairs, keylength
    end function

    subroutine srtfpk(case, packed, header1, map, keys, nmap, nkeypairs, compress) &
        bind(c, name='SRTFPK')
      import :: c_int32_t, c_int64_t
      integer(c_int64_t), intent(in) :: case(*)
      integer(c_int32_t), intent(inout) :: packed(*)
      integer(c_int32_t), intent(in) :: header1, map(*), keys(*), nmap, nkeypairs, compress
    end subroutine

    subroutine srtfup(packed, case, map, keys, nmap, nkeypairs, compress) bind(c, name='SRTFUP')
      import :: c_int32_t, c_int64_t
      integer(c_int32_t), intent(inout) :: packed(*)
      integer(c_int64_t), intent(inout) :: case(*)
      integer(c_int32_t), intent(in) :: map(*), keys(*), nmap, nkeypairs, compress
    end subroutine
  end interface

contains

  ! SORTFILE with arguments 7 to 9 null; arguments 10 and 11 start as garbage
  ! and must come back 0 whatever the result. Returns SORTFILE's result.
  integer(c_int32_t) function sort_checked(context, input, output, nvars, ukeys, nukeys, what)
    integer(c_int32_t), intent(inout) :: context
    type(c_funptr), value :: input, output
    integer(c_int32_t), intent(in) :: nvars, nukeys, ukeys(*)
    character(len=*), intent(in) :: what
    integer(c_int32_t) :: a10, a11
    a10 = 99
    a11 = 99
    sort_checked = sortfile(context, input, output, nvars, ukeys, nukeys, &
                            c_null_ptr, c_null_ptr, c_null_ptr, a10, a11)
    call check(a10 == 0 .and. a11 == 0, 'arguments 10 and 11 are 0: '//what)
  end function

  ! Stops the program with a failure when `ok` is false.
  subroutine check(ok, what)
    logical, intent(in) :: ok
    character(len=*), intent(in) :: what
    if (.not. ok) then
      write (*, '(2a)') 'FAILED: ', what
      error stop 1
    end if
  end subroutine
end module
